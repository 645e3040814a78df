#pragma once

#include <functional>
#include <string_view>

namespace yomber {

// Copies between open files, for whoever makes a file out of another one. Each answers 0 or an
// errno.

/// Copies the content of a regular file into an empty one, by sharing blocks where the file system
/// can. Holes stay holes. A source that grows meanwhile is copied up to the size that it had.
[[nodiscard]] int copyFileContent(int source, int destination);

/// Copies the user attributes whose names `isWanted` accepts.
[[nodiscard]] int copyUserAttributes(int source, int destination,
                                     const std::function<bool(std::string_view name)>& isWanted);

}  // namespace yomber
