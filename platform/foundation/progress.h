#pragma once

#include <cstdint>
#include <functional>
#include <memory>

namespace yomber {

class NSProgress;
using NSProgressRef = std::shared_ptr<NSProgress>;

/// How far a piece of work is, and the way to call it off.
///
/// Ownership: shared between who works and who watches. The cancellation handler is held strongly
/// until it was called or replaced, so it should hold weakly what holds the progress.
/// Thread-safety: every operation may be called on any thread; handlers run on the cancelling one.
class NSProgress {
 public:
  static NSProgressRef progressWithTotalUnitCount(std::int64_t unitCount);
  ~NSProgress();
  NSProgress(const NSProgress&) = delete;
  NSProgress& operator=(const NSProgress&) = delete;

  [[nodiscard]] std::int64_t totalUnitCount() const;
  void setTotalUnitCount(std::int64_t count);
  [[nodiscard]] std::int64_t completedUnitCount() const;
  void setCompletedUnitCount(std::int64_t count);
  /// Called after each setting of a count, on the thread that set it; so it must not block. One at
  /// a time may be there; empty takes it away. Held strongly.
  void setUpdateHandler(std::function<void()> handler);
  /// Between 0 and 1, children included by their share; 0 while nothing is known.
  [[nodiscard]] double fractionCompleted() const;
  /// `child` makes up `pendingUnitCount` units of this one, and is cancelled with it. It is kept.
  void addChild(const NSProgressRef& child, std::int64_t pendingUnitCount);

  [[nodiscard]] bool isCancellable() const;
  /// A mark for whoever shows the progress; `cancel` works in any case. Set at first.
  void setCancellable(bool cancellable);
  [[nodiscard]] bool isCancelled() const;
  /// Called once, by the first `cancel`; at once when that was before. May be empty.
  void setCancellationHandler(std::function<void()> handler);
  /// Cancels this one and then its children. Further calls do nothing.
  void cancel();

 private:
  struct State;
  explicit NSProgress(std::int64_t unitCount);
  void set(std::int64_t State::* count, std::int64_t value);
  std::unique_ptr<State> state_;
};

}  // namespace yomber
