#pragma once

#include <utility>

#include "platform/foundation/lock.h"

namespace yomber {

/// A field that is read and written without any lock of its owner's.
///
/// One leaf lock inside, nothing else is ever taken under it; the value is copied in and out, and a
/// value that was replaced is destroyed after the lock was left.
template <typename T>
class AtomicCell {
 public:
  AtomicCell() = default;
  explicit AtomicCell(T value) : value_(std::move(value)) {}

  [[nodiscard]] T load() const {
    LockGuard guard(mutex_);
    return value_;
  }
  void store(T value) { (void)exchange(std::move(value)); }
  T exchange(T value) {
    LockGuard guard(mutex_);
    std::swap(value_, value);
    return value;
  }

 private:
  mutable Mutex mutex_;
  T value_ GUARDED_BY(mutex_){};
};

}  // namespace yomber
