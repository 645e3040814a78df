#pragma once

#include <chrono>
#include <utility>
#include <vector>

#include "platform/foundation/lock.h"

namespace yomber {

/// What handlers were given, for tests to wait for.
///
/// Thread-safety: every operation may be called on any thread.
template <typename T>
class Awaited {
 public:
  void add(T value) {
    LockGuard guard(mutex_);
    values_.push_back(std::move(value));
    condition_.notifyAll();
  }
  /// The values once there are `count`, or fewer after ten seconds.
  [[nodiscard]] std::vector<T> wait(std::size_t count = 1) {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    LockGuard guard(mutex_);
    while (values_.size() < count && condition_.waitUntil(mutex_, deadline)) {
    }
    return values_;
  }
  [[nodiscard]] std::vector<T> values() {
    LockGuard guard(mutex_);
    return values_;
  }

 private:
  Mutex mutex_;
  Condition condition_;
  std::vector<T> values_ GUARDED_BY(mutex_);
};

}  // namespace yomber
