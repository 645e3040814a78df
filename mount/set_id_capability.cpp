#include "mount/set_id_capability.h"

#include <sys/syscall.h>
#include <unistd.h>

namespace yomber {
namespace {

/// Of the calling thread alone; the C library has no name for it.
__user_cap_header_struct thisThread() { return {.version = _LINUX_CAPABILITY_VERSION_3, .pid = 0}; }

}  // namespace

WithoutSetIDCapability::WithoutSetIDCapability() {
  auto header = thisThread();
  if (syscall(SYS_capget, &header, before_.data()) != 0) return;
  Rights without = before_;
  without[CAP_TO_INDEX(CAP_FSETID)].effective &= ~CAP_TO_MASK(CAP_FSETID);
  isTaken_ = syscall(SYS_capset, &header, without.data()) == 0;
}

WithoutSetIDCapability::~WithoutSetIDCapability() {
  auto header = thisThread();
  if (isTaken_) (void)syscall(SYS_capset, &header, before_.data());
}

}  // namespace yomber
