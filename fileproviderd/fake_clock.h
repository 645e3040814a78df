#pragma once

#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <utility>

#include "fileproviderd/host_clock.h"

namespace yomber {

/// Time that a test moves.
class FakeClock final : public HostClock {
 public:
  [[nodiscard]] TimePoint now() const override { return now_; }

  [[nodiscard]] TimerRef after(std::chrono::milliseconds delay,
                               std::function<void()> work) override {
    auto kept = std::make_shared<std::function<void()>>(std::move(work));
    timers_.emplace(now_ + delay, kept);
    delays.push_back(delay);
    return std::make_unique<FakeTimer>(std::move(kept));
  }

  /// Runs what is due on the way, in its order, and `between` after each.
  void advance(std::chrono::milliseconds by, const std::function<void()>& between = {}) {
    const auto until = now_ + by;
    while (!timers_.empty() && timers_.begin()->first <= until) {
      const auto first = timers_.begin();
      now_ = first->first;
      const auto work = first->second.lock();
      timers_.erase(first);
      if (work) (*work)();
      if (between) between();
    }
    now_ = until;
  }

  /// Of every timer that was set, in order.
  std::deque<std::chrono::milliseconds> delays;

 private:
  struct FakeTimer final : Timer {
    explicit FakeTimer(std::shared_ptr<std::function<void()>> kept) : work(std::move(kept)) {}
    const std::shared_ptr<std::function<void()>> work;
  };
  TimePoint now_{std::chrono::hours(1)};
  std::multimap<TimePoint, std::weak_ptr<std::function<void()>>> timers_;
};

/// Runs what was put off, one step at a time.
class ManualExecutor {
 public:
  void post(std::function<void()> work) { waiting_.push_back(std::move(work)); }
  bool step() {
    if (waiting_.empty()) return false;
    const auto work = std::move(waiting_.front());
    waiting_.pop_front();
    work();
    return true;
  }
  /// Until nothing is left; false when that takes suspiciously long.
  bool drain() {
    constexpr int kMany = 1'000'000;
    for (int steps = 0; step(); ++steps) {
      if (steps > kMany) return false;
    }
    return true;
  }
  [[nodiscard]] bool isEmpty() const { return waiting_.empty(); }

 private:
  std::deque<std::function<void()>> waiting_;
};

}  // namespace yomber
