#pragma once

#include <chrono>
#include <cstddef>
#include <functional>
#include <memory>

namespace yomber {

/// Threads for work that may block.
///
/// A new thread is started at once while there are few of them; beyond that only when work waits
/// and nothing has moved for a moment, that is when the threads that exist are blocked. A bounded
/// number of idle threads is kept; others end after a while without work. When the last of them has
/// ended for as long, one that is kept gives the memory back that the process has freed. At the
/// hard bound, work waits for a thread and a fault is logged.
///
/// Thread-safety: every operation may be called on any thread.
class ThreadPool {
 public:
  struct Limits {
    std::size_t promptThreads = 16;  ///< up to so many are started without waiting for a stall
    std::size_t maximumThreads = 512;
    std::size_t keptIdleThreads = 4;  ///< idle threads that never end
    std::chrono::milliseconds idleTime{10'000};
    std::chrono::milliseconds stallTime{2};
  };

  explicit ThreadPool(Limits limits);
  /// Runs what is queued and waits for all threads to end.
  ~ThreadPool();
  ThreadPool(const ThreadPool&) = delete;
  ThreadPool& operator=(const ThreadPool&) = delete;

  /// The pool of this process; it lives until the process ends.
  static ThreadPool& shared();

  /// Runs `work` on some thread of the pool. Work starts in order of submission, but several run at
  /// a time. `work` must not throw.
  void async(std::function<void()> work);

  [[nodiscard]] std::size_t threadCount() const;

 private:
  friend class PoolThreads;
  struct State;
  std::shared_ptr<State> state_;
};

}  // namespace yomber
