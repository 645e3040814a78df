#pragma once

#include <string>
#include <vector>

namespace yomber {

/// Where this user's and this machine's data lies: $XDG_DATA_HOME, then $XDG_DATA_DIRS, with the
/// defaults of the XDG base directories; each with `subfolder` appended. The earlier count first.
/// Relative ones are left out. Thread-safety: any thread, while nobody changes the environment.
[[nodiscard]] std::vector<std::string> dataDirectories(const std::string& subfolder);

/// $XDG_CACHE_HOME, or ~/.cache. Empty when neither is known.
[[nodiscard]] std::string cacheDirectory();

}  // namespace yomber
