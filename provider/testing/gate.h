#pragma once

#include <chrono>

#include "platform/foundation/lock.h"

namespace yomber {

/// Something that happens once and that others wait for.
///
/// Thread-safety: every operation may be called on any thread.
class Gate {
 public:
  void open() {
    LockGuard guard(_lock);
    _isOpen = true;
    _changed.notifyAll();
  }
  [[nodiscard]] bool isOpen() {
    LockGuard guard(_lock);
    return _isOpen;
  }
  /// Whether it was opened before `patience` was over.
  [[nodiscard]] bool wait(std::chrono::milliseconds patience = std::chrono::seconds(10)) {
    const auto deadline = std::chrono::steady_clock::now() + patience;
    LockGuard guard(_lock);
    while (!_isOpen) {
      if (!_changed.waitUntil(_lock, deadline)) return _isOpen;
    }
    return true;
  }

 private:
  Mutex _lock;
  Condition _changed;
  bool _isOpen GUARDED_BY(_lock) = false;
};

}  // namespace yomber
