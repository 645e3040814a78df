#include "platform/ipc/gate.h"

#include <linux/futex.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace yomber::ipc {

static_assert(std::atomic<std::uint32_t>::is_always_lock_free);

void Gate::open() {
  // After the exchange only the address counts: a wake-up for nobody does no harm.
  if (state_.exchange(kOpen, std::memory_order_acq_rel) != kAwaited) return;
  ::syscall(SYS_futex, &state_, FUTEX_WAKE_PRIVATE, 1, nullptr, nullptr, 0);
}

void Gate::wait() {
  std::uint32_t expected = kClosed;
  state_.compare_exchange_strong(expected, kAwaited, std::memory_order_acq_rel);
  while (state_.load(std::memory_order_acquire) != kOpen) {
    ::syscall(SYS_futex, &state_, FUTEX_WAIT_PRIVATE, std::uint32_t{kAwaited}, nullptr, nullptr, 0);
  }
}

}  // namespace yomber::ipc
