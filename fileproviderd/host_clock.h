#pragma once

#include <chrono>
#include <functional>
#include <memory>

namespace yomber {

/// Time, as the host sees it; tests command their own.
///
/// Thread-safety: loop thread only.
class HostClock {
 public:
  using TimePoint = std::chrono::steady_clock::time_point;
  /// Destroying it calls the work off.
  class Timer {
   public:
    virtual ~Timer() = default;
  };
  using TimerRef = std::unique_ptr<Timer>;

  virtual ~HostClock() = default;
  [[nodiscard]] virtual TimePoint now() const = 0;
  /// Runs `work` once after `delay`, never before returning. The work may destroy its own timer.
  [[nodiscard]] virtual TimerRef after(std::chrono::milliseconds delay,
                                       std::function<void()> work) = 0;
};

/// The time of the process's event loop.
class LoopClock final : public HostClock {
 public:
  [[nodiscard]] TimePoint now() const override { return std::chrono::steady_clock::now(); }
  [[nodiscard]] TimerRef after(std::chrono::milliseconds delay,
                               std::function<void()> work) override;
};

}  // namespace yomber
