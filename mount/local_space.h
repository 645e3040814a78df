#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <thread>
#include <unordered_map>
#include <vector>

#include "mount/content_requests.h"
#include "mount/places.h"
#include "platform/foundation/lock.h"

namespace yomber {

/// Keeps the content that is on this disk within a bound: when more has come, that which was not
/// used for the longest time is given up again. The host is asked for each, and refuses what is
/// pinned, open, needed, or not in the store yet; so the bound may be exceeded by these.
///
/// Thread-safety: every operation may be called on any thread. A thread of its own does the work.
class LocalSpace {
 public:
  /// `limit` in bytes of disk blocks.
  LocalSpace(const Places& places, std::shared_ptr<ContentRequests> requests, std::uint64_t limit);
  ~LocalSpace();
  LocalSpace(const LocalSpace&) = delete;
  LocalSpace& operator=(const LocalSpace&) = delete;

  /// An application has opened the file with that inode.
  void noteUse(std::uint64_t inode);
  /// Content has come, or was written.
  void noteGrowth();

 private:
  struct File {
    std::string path;
    std::uint64_t bytes = 0;   ///< of disk blocks
    std::int64_t lastUse = 0;  ///< ns since the epoch
    friend bool operator<(const File& a, const File& b) { return a.lastUse < b.lastUse; }
  };
  void run();
  /// False when nothing could be given up although it should.
  bool giveUpSome();
  [[nodiscard]] std::uint64_t findUnused(std::vector<File>& oldest);
  [[nodiscard]] std::int64_t lastUseOf(std::uint64_t inode, std::int64_t accessed);
  [[nodiscard]] bool isEnding();

  const Places& places_;
  const std::shared_ptr<ContentRequests> requests_;
  const std::uint64_t limit_;
  Mutex mutex_;
  Condition changed_;
  std::unordered_map<std::uint64_t, std::int64_t> uses_ GUARDED_BY(mutex_);  ///< ns, by inode
  bool hasGrown_ GUARDED_BY(mutex_) = true;
  bool isEnding_ GUARDED_BY(mutex_) = false;
  std::thread thread_;
};

}  // namespace yomber
