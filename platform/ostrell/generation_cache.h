#pragma once

#include <cstdint>
#include <optional>
#include <utility>

#include "platform/foundation/lock.h"

namespace yomber {

/// One answer of the daemon, kept until it may have changed.
///
/// Whoever fills it takes the generation before asking: an answer to a question asked before a
/// change is not kept after it.
/// Thread-safety: every operation may be called on any thread.
template <typename T>
class GenerationCache {
 public:
  [[nodiscard]] std::optional<T> value() const {
    LockGuard guard(mutex_);
    return value_;
  }
  [[nodiscard]] std::uint64_t generation() const {
    LockGuard guard(mutex_);
    return generation_;
  }
  /// Keeps `value` unless the cache was emptied since `generation` was taken.
  void store(std::uint64_t generation, T value) {
    std::optional<T> kept(std::move(value));
    LockGuard guard(mutex_);
    if (generation == generation_) std::swap(value_, kept);
  }
  void empty() {
    std::optional<T> dropped;
    LockGuard guard(mutex_);
    ++generation_;
    std::swap(value_, dropped);
  }

 private:
  mutable Mutex mutex_;
  std::uint64_t generation_ GUARDED_BY(mutex_) = 0;
  std::optional<T> value_ GUARDED_BY(mutex_);
};

}  // namespace yomber
