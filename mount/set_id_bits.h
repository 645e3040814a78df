#pragma once

#include <sys/stat.h>
#include <sys/types.h>

#include "mount/fuse.h"

namespace yomber {

/// The set-id bits that a file loses when somebody changes its content or owner. Root may leave
/// them there; a member of the file's group may leave a set-gid bit that lets nobody run as the
/// group. None where we are not root: the kernel sees to all that then.
[[nodiscard]] mode_t setIDToTake(fuse_req_t request, const struct stat& status);

/// Takes them away from an open file whose content is about to be changed: root changes files for
/// everybody, and so leaves them itself. Before the change, and not put back if it fails: otherwise
/// somebody could run, with those bits, for a moment what another has written.
void takeSetIDAway(fuse_req_t request, int file);

}  // namespace yomber
