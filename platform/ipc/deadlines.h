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
/// Loop thread only. Its entries must be gone before it is.
class Deadlines {
 public:
  using Clock = std::chrono::steady_clock;

 private:
  struct Pending;
  using Map = std::multimap<Clock::time_point, Pending>;

 public:
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

  explicit Deadlines(kj::Timer& timer);

  /// Calls `onExpiry` on the loop thread when `delay` has passed, unless `entry` is cleared first.
  void set(Entry& entry, std::chrono::milliseconds delay, std::function<void()> onExpiry);

 private:
  struct Pending {
    Entry* entry;
    std::function<void()> onExpiry;
  };

  kj::Promise<void> watch();
  void expireDue();

  kj::Timer& timer_;
  Map entries_;
  /// When `watch` looks again; nothing when it waits for a first entry.
  std::optional<Clock::time_point> watchedFor_;
  /// Makes `watch` look again now.
  kj::Own<kj::PromiseFulfiller<void>> lookAgain_;
  kj::Promise<void> task_;
};

}  // namespace yomber::ipc
