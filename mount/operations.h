#pragma once

#include "mount/fuse.h"

namespace yomber {

/// The kernel's requests, each handed to the FileSystem of the session that it came through.
[[nodiscard]] fuse_lowlevel_ops mountOperations();

}  // namespace yomber
