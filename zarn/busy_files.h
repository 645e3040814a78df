#pragma once

#include <cstdint>
#include <unordered_map>

#include "platform/foundation/lock.h"

namespace yomber {

/// Files whose content is being filled in or given up. Until that has ended, their sizes and dates
/// on disk are of no account, and their rows stay as they are.
///
/// Thread-safety: every operation may be called on any thread.
class BusyFiles {
 public:
  void add(std::uint64_t inode) {
    LockGuard guard(mutex_);
    ++inodes_[inode];
  }
  void remove(std::uint64_t inode) {
    LockGuard guard(mutex_);
    const auto found = inodes_.find(inode);
    if (found != inodes_.end() && --found->second == 0) inodes_.erase(found);
  }
  [[nodiscard]] bool contains(std::uint64_t inode) const {
    LockGuard guard(mutex_);
    return !inodes_.empty() && inodes_.contains(inode);
  }

 private:
  mutable Mutex mutex_;
  std::unordered_map<std::uint64_t, int> inodes_ GUARDED_BY(mutex_);
};

}  // namespace yomber
