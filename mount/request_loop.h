#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <thread>
#include <vector>

#include "mount/fuse.h"
#include "platform/foundation/lock.h"

namespace yomber {

/// The threads that read the kernel's requests and have them answered.
///
/// One of them has the turn: it reads. It keeps the turn while it answers, since waking another
/// thread costs more than most answers do; one that takes longer than a moment, or is known to
/// beforehand, is carried on without the turn, which another takes. When requests queue up, each is
/// answered without it. Before it sleeps, the one who reads looks out for the next request for some
/// microseconds, as long as that pays: whoever waits for one answer at a time asks again at once.
///
/// Thread-safety: `run` is called once; nothing else concerns more than one thread.
class RequestLoop {
 public:
  /// Where requests come from, and who answers them. Called on the loop's threads, `receive` by one
  /// at a time.
  struct Source {
    /// Readable when there is a request.
    int device = -1;
    /// The size of the request that it has put into the buffer; 0: there will be no more;
    /// -EAGAIN: none is there yet; another errno, negative: the loop ends with it.
    std::function<int(fuse_buf&)> receive;
    std::function<void(const fuse_buf&)> answer;
    std::function<bool(const fuse_buf&)> mayTakeLong;
  };
  /// An answer that takes longer is carried on without the turn.
  static constexpr std::chrono::milliseconds kMoment{1};

  /// `mostThreads` is 2 or more: with fewer, one long answer would hold up all others.
  RequestLoop(Source source, unsigned mostThreads);
  ~RequestLoop();
  RequestLoop(const RequestLoop&) = delete;
  RequestLoop& operator=(const RequestLoop&) = delete;

  /// Returns when there are no more requests and all are answered: 0 or an errno.
  [[nodiscard]] int run();

 private:
  /// Who has the turn, as one word: a number that is another for each request read and for each
  /// thread that takes the turn, and whether a request is being answered.
  using State = std::uint64_t;
  static constexpr State kAnswering = 1;
  static constexpr State kNext = 2;

  void work();
  [[nodiscard]] bool waitForTurn();
  void takeTurn() REQUIRES(mutex_);
  void addThread() REQUIRES(mutex_);
  void watch() REQUIRES(mutex_);
  int read(fuse_buf& request);
  int lookOut(fuse_buf& request);
  /// Whether this thread still has the turn.
  [[nodiscard]] bool answer(const fuse_buf& request);
  void wakeWatcher();
  void passOn();
  void end(int failure);

  const Source source_;
  const unsigned mostThreads_;

  // Of the one who has the turn.
  std::chrono::microseconds lookOut_{0};
  unsigned inARow_ = 0;  ///< requests that were there already when they were asked for

  std::atomic<State> state_ = 0;
  std::atomic<bool> isWatched_ = false;  ///< an idle thread looks after long answers

  Mutex mutex_;
  Condition changed_;
  bool isVacant_ GUARDED_BY(mutex_) = true;  ///< nobody has the turn
  bool hasWatcher_ GUARDED_BY(mutex_) = false;
  unsigned idle_ GUARDED_BY(mutex_) = 0;
  bool isOver_ GUARDED_BY(mutex_) = false;
  int failure_ GUARDED_BY(mutex_) = 0;
  std::vector<std::thread> others_ GUARDED_BY(mutex_);
};

}  // namespace yomber
