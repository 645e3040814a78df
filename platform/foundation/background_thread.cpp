#include "platform/foundation/background_thread.h"

#include <sys/resource.h>
#include <unistd.h>

namespace yomber {
namespace {

/// A ninth of the processor beside a thread that wants it all, rather than none: others may come to
/// wait for what this one holds.
constexpr int kNiceness = 10;

}  // namespace

void giveWayToOthers() { (void)setpriority(PRIO_PROCESS, static_cast<id_t>(gettid()), kNiceness); }

}  // namespace yomber
