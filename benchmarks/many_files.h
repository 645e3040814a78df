#pragma once

#include <cstddef>
#include <string>

namespace yomber::bench {

/// Makes `count` files of a few bytes in `folder`, named as people's files are.
void makeFiles(const std::string& folder, std::size_t count);

/// Seconds that a warm `find DIRECTORY -printf '%p %s %T@\n'` takes.
[[nodiscard]] double warmFindSeconds(const std::string& directory);

}  // namespace yomber::bench
