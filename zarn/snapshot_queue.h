#pragma once

#include <deque>
#include <memory>
#include <vector>

#include "platform/foundation/lock.h"

namespace yomber {

/// Hands folders from the thread that reads them to the one that stores them, and holds the reader
/// back while too much is waiting.
///
/// Thread-safety: one pusher, one taker.
template <typename T>
class SnapshotQueue {
 public:
  SnapshotQueue(std::size_t maximumFolders, std::size_t maximumEntries)
      : maximumFolders_(maximumFolders), maximumEntries_(maximumEntries) {}

  /// Waits for room. False once the taker has given up.
  bool push(T folder, std::size_t entries) {
    LockGuard guard(mutex_);
    while (!isAbandoned_ && !waiting_.empty() &&
           (waiting_.size() >= maximumFolders_ || entries_ + entries > maximumEntries_)) {
      changed_.wait(mutex_);
    }
    if (isAbandoned_) return false;
    waiting_.push_back(std::move(folder));
    entries_ += entries;
    changed_.notifyAll();
    return true;
  }

  /// No more will come.
  void finish() {
    LockGuard guard(mutex_);
    isFinished_ = true;
    changed_.notifyAll();
  }

  /// All that is waiting; waits while nothing is. Empty: there will be no more.
  std::vector<T> take() {
    LockGuard guard(mutex_);
    while (waiting_.empty() && !isFinished_) changed_.wait(mutex_);
    std::vector<T> taken(std::make_move_iterator(waiting_.begin()),
                         std::make_move_iterator(waiting_.end()));
    waiting_.clear();
    entries_ = 0;
    changed_.notifyAll();
    return taken;
  }

  /// Lets the pusher go.
  void abandon() {
    LockGuard guard(mutex_);
    isAbandoned_ = true;
    waiting_.clear();
    changed_.notifyAll();
  }

 private:
  const std::size_t maximumFolders_;
  const std::size_t maximumEntries_;
  Mutex mutex_;
  Condition changed_;
  std::deque<T> waiting_ GUARDED_BY(mutex_);
  std::size_t entries_ GUARDED_BY(mutex_) = 0;
  bool isFinished_ GUARDED_BY(mutex_) = false;
  bool isAbandoned_ GUARDED_BY(mutex_) = false;
};

}  // namespace yomber
