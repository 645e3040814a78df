#pragma once

#include <cstddef>
#include <string>

namespace yomber::bench {

/// Makes `count` files in `folder`, named as people's files are, their dates in no order with their
/// names. Nearly all are empty: a listing reads no content.
void makeFiles(const std::string& folder, std::size_t count);

/// Seconds that `find DIRECTORY -printf '%p %s %T@\n'` takes.
[[nodiscard]] double findSeconds(const std::string& directory);

/// Seconds that a warm `find DIRECTORY -printf '%p %s %T@\n'` takes.
[[nodiscard]] double warmFindSeconds(const std::string& directory);

}  // namespace yomber::bench
