#include "zarn/coalesced_call.h"

#include <utility>

namespace yomber {

void CoalescedCall::request() {
  {
    LockGuard guard(mutex_);
    if (std::exchange(isOnItsWay_, true)) {
      isDueAgain_ = true;
      return;
    }
  }
  send_([self = shared_from_this()](const NSErrorRef&) { self->answered(); });
}

void CoalescedCall::answered() {
  bool isDue = false;
  {
    LockGuard guard(mutex_);
    isOnItsWay_ = false;
    isDue = std::exchange(isDueAgain_, false);
  }
  if (isDue) request();
}

}  // namespace yomber
