#pragma once

#include <kj/async.h>
#include <kj/timer.h>

#include <chrono>
#include <functional>
#include <map>
#include <optional>

namespace yomber::ipc {

/// Many deadlines behind one timer. Calls nearly always end long before theirs, so adding and
/// removing one touches no timer: the timer looks again when the earliest it knew of has come.
///
/// Loop thread only.
class Deadlines {
 public:
  using Clock = std::chrono::steady_clock;
  using Map = std::multimap<Clock::time_point, std::function<void()>>;

  /// One deadline; removed with its owner.
  class Entry {
   public:
    Entry() = default;
    Entry(const Entry&) = delete;
    Entry& operator=(const Entry&) = delete;
    ~Entry() { clear(); }
    void clear();

   private:
    friend class Deadlines;
    Deadlines* list_ = nullptr;
    Map::iterator position_;
  };

  explicit Deadlines(kj::Timer& timer) : timer_(timer) {}

  /// Calls `onExpiry` on the loop thread when `delay` has passed, unless `entry` is cleared first.
  void set(Entry& entry, std::chrono::milliseconds delay, std::function<void()> onExpiry);

 private:
  void arm();
  void expire();

  kj::Timer& timer_;
  Map entries_;
  /// When the timer that runs fires; nothing when none runs.
  std::optional<Clock::time_point> armedFor_;
  kj::Promise<void> wait_ = nullptr;
};

}  // namespace yomber::ipc
