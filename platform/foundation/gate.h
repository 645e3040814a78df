#pragma once

#include <chrono>

#include "platform/foundation/lock.h"

namespace yomber {

/// For tests: something that threads wait for, with a deadline instead of a hang.
class Gate {
 public:
  /// Counts one arrival.
  void open() {
    LockGuard guard(mutex_);
    ++arrivals_;
    changed_.notifyAll();
  }
  /// False when there were not `count` arrivals within the time that a slow machine may need.
  [[nodiscard]] bool wait(int count = 1) {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(30);
    LockGuard guard(mutex_);
    while (arrivals_ < count) {
      if (!changed_.waitUntil(mutex_, deadline)) return arrivals_ >= count;
    }
    return true;
  }

 private:
  Mutex mutex_;
  Condition changed_;
  int arrivals_ GUARDED_BY(mutex_) = 0;
};

}  // namespace yomber
