#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <unordered_map>
#include <utility>
#include <vector>

#include "mount/node_table.h"
#include "platform/foundation/lock.h"
#include "platform/foundation/thread_pool.h"

namespace yomber {

/// Tells the kernel of entries that are no longer what it knows.
///
/// It locks the folder of each, and holds the folders of a rename until that is answered: where one
/// waits for content, what concerns its folders is told afterwards, and holds up nothing else.
/// Thread-safety: any threads.
class EntryNotices {
 public:
  struct Notice {
    NodeUse folder;
    std::string name;      ///< as shown
    bool isOther = false;  ///< it is another one, or gone; else it may be
  };
  /// Tells the kernel of one; called on threads of the pool, and may wait there.
  using Tell = std::function<void(const Notice&)>;

  /// `pool` outlives it.
  EntryNotices(Tell tell, ThreadPool& pool) : tell_(std::move(tell)), pool_(pool) {}
  EntryNotices(const EntryNotices&) = delete;
  EntryNotices& operator=(const EntryNotices&) = delete;

  /// Returns when the kernel has been told, but of what concerns folders that are held.
  void send(std::vector<Notice> notices);

  /// Folders are held while it lives. To be dropped when the request has been answered.
  class Hold {
   public:
    Hold(EntryNotices& notices, const Node& folder, const Node& other);
    ~Hold();
    Hold(const Hold&) = delete;
    Hold& operator=(const Hold&) = delete;

   private:
    EntryNotices& notices_;
    const Node& folder_;
    const Node& other_;
  };

 private:
  struct Held {
    unsigned count = 0;
    std::vector<Notice> notices;
  };
  struct Batch;

  /// Of both at once: whoever is woken by it passes what concerns either.
  void begin(const Node& folder, const Node& other);
  void end(const Node& folder);
  [[nodiscard]] bool isHeld(const Node* folder) const REQUIRES(mutex_);
  void sendSoon(std::vector<Notice> notices);
  void tellAll(Batch& batch, std::uint64_t teller);
  /// The next one of a folder that is not held; nil when there are no more.
  const Notice* next(Batch& batch) REQUIRES(mutex_);

  const Tell tell_;
  ThreadPool& pool_;
  Mutex mutex_;
  Condition changed_;
  std::unordered_map<const Node*, Held> held_ GUARDED_BY(mutex_);
};

}  // namespace yomber
