#pragma once

#include <fcntl.h>

namespace yomber {

/// Reads through this descriptor, of a file or a folder, leave the date of access: nobody uses it.
/// Where it is somebody else's, they do not.
inline void readUnnoticed(int descriptor) {
  const int flags = fcntl(descriptor, F_GETFL);
  if (flags >= 0) (void)fcntl(descriptor, F_SETFL, flags | O_NOATIME);
}

}  // namespace yomber
