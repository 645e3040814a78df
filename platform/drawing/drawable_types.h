#pragma once

#include <string_view>

namespace yomber {

/// Whether pictures of this MIME type are drawn. Decides by the name alone, and so costs nothing.
[[nodiscard]] bool isDrawableType(std::string_view type);

}  // namespace yomber
