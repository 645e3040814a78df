#pragma once

#include <atomic>
#include <cstdint>

namespace yomber::ipc {

/// A flag that one thread waits for and another raises, once.
///
/// It may live on the waiting thread's stack: whoever opens it reads and writes it no more once the
/// waiter can return. What was written before `open` is seen after `wait`.
class Gate {
 public:
  void open();
  void wait();

 private:
  enum : std::uint32_t { kClosed = 0, kAwaited = 1, kOpen = 2 };
  std::atomic<std::uint32_t> state_{kClosed};
};

}  // namespace yomber::ipc
