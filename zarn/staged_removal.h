#pragma once

#include <cstdint>
#include <string>

#include "platform/foundation/error.h"

namespace yomber {

/// What was removed, and what stood in the way first.
struct RemovedItems {
  std::uint64_t count = 0;  ///< files, links and folders
  int failure = 0;          ///< errno of the first failure; 0 when nothing is left
};

/// Removes all that the open folder holds, and leaves the folder itself.
///
/// Needs a handful of descriptors however deep it goes: what lies in a folder below is moved up
/// before it is looked into. So the folder must be nobody else's, and what could not be removed
/// lies in it under another name. Never follows symbolic links. For one thread at a time.
[[nodiscard]] RemovedItems removeStaged(int folder);

}  // namespace yomber
