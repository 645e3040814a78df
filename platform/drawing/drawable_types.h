#pragma once

#include <cstddef>
#include <string_view>

namespace yomber {

/// Whether pictures of this MIME type are drawn. Decides by the name alone, and so costs nothing.
[[nodiscard]] bool isDrawableType(std::string_view type);

/// How much of a file's start `isDrawableStart` wants to see, in bytes.
inline constexpr std::size_t kDrawableStart = 1024;
/// Whether a file that begins so looks like one that is drawn, where its name does not tell.
[[nodiscard]] bool isDrawableStart(std::string_view start);

}  // namespace yomber
