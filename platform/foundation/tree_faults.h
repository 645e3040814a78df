#pragma once

#include <string>

namespace yomber {

/// Whether the file there is without its content, or any file below the folder there is. Never
/// follows a link. What cannot be looked at counts as without.
[[nodiscard]] bool holdsFault(const std::string& path);

}  // namespace yomber
