#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <thread>
#include <unordered_map>
#include <utility>
#include <vector>

#include "mount/places.h"
#include "platform/foundation/error.h"
#include "platform/foundation/lock.h"

namespace yomber {

/// Keeps the content that is on this disk within a bound: when more has come, that which was not
/// used for the longest time is given up again, and a sixteenth of the bound besides, so that the
/// next file does not have all looked through again. The host is asked for each, and refuses what
/// is pinned, open, needed, or not in the store yet; so the bound may be exceeded by these. What
/// every file keeps, its first block, is not counted.
///
/// The tree is looked through only when what is known to have come may exceed the bound, and
/// now and then while others change it. When nothing more can be given up, those that were refused
/// are asked for again, each time after a longer pause, and nothing else happens.
///
/// Thread-safety: every operation may be called on any thread. A thread of its own does the work.
class LocalSpace {
 public:
  /// Gives the content of the document with that location, as the drive has it, up.
  using GiveUp = std::function<NSErrorRef(const std::string& location)>;
  struct Pace {
    /// What comes in a burst is looked at once.
    std::chrono::milliseconds burst{1'000};
    /// Between looks at what others change; more where a look takes long.
    std::chrono::milliseconds others{60'000};
    /// What was refused may be given up later: it was closed, or is in the store now.
    std::chrono::milliseconds firstRetry{30'000};
    std::chrono::milliseconds longestRetry{3'600'000};
  };

  /// `limit` in bytes of disk blocks.
  LocalSpace(const Places& places, GiveUp giveUp, std::uint64_t limit, Pace pace);
  LocalSpace(const Places& places, GiveUp giveUp, std::uint64_t limit)
      : LocalSpace(places, std::move(giveUp), limit, Pace()) {}
  ~LocalSpace();
  LocalSpace(const LocalSpace&) = delete;
  LocalSpace& operator=(const LocalSpace&) = delete;

  /// An application has opened the file with that inode.
  void noteUse(std::uint64_t inode);
  /// Content has come, or was written: so many bytes of blocks, or fewer.
  void noteGrowth(std::uint64_t bytes);
  /// Something in the tree has changed, whoever did it.
  void noteChange();

  /// How often the tree was looked through.
  [[nodiscard]] std::uint64_t looks() const;
  /// Whether more is here than should be, and nothing of it can be given up at the moment.
  [[nodiscard]] bool isStuck() const;

 private:
  using Clock = std::chrono::steady_clock;
  /// Those that are unused for longest go first.
  struct Age {
    std::int64_t lastUse = 0;  ///< ns since the epoch
    std::uint64_t inode = 0;
    friend auto operator<=>(const Age&, const Age&) = default;
  };
  struct File {
    Age age;
    std::uint32_t base = 0;
    std::string path;
    std::uint64_t bytes = 0;  ///< of disk blocks
    friend bool operator<(const File& a, const File& b) { return a.age < b.age; }
  };
  /// Of one time that content is given up, over several looks when it has to.
  struct Progress {
    std::uint64_t total = 0;   ///< what all content takes
    std::uint64_t given = 0;   ///< up
    std::optional<Age> tried;  ///< the last one that was asked for
  };
  enum class Work : std::uint8_t { End, Look, Retry };

  void run();
  [[nodiscard]] Work waitForWork();
  [[nodiscard]] std::optional<Work> due(Clock::time_point now) const REQUIRES(mutex_);
  [[nodiscard]] Clock::time_point nextLook() const REQUIRES(mutex_);
  void lookThrough();
  void retry();
  [[nodiscard]] bool find(Progress& progress, std::vector<File>& oldest);
  [[nodiscard]] bool giveUpOldest(std::vector<File>& oldest, Progress& progress);
  [[nodiscard]] std::string locationOf(const File& file) const;
  [[nodiscard]] std::int64_t lastUseOf(std::uint64_t inode, std::int64_t accessed) const;
  [[nodiscard]] bool isEnding() const;

  const Places& places_;
  const GiveUp giveUp_;
  const std::uint64_t limit_;
  const std::uint64_t enough_;  ///< down to which content is given up
  const Pace pace_;

  // Of the thread.
  std::vector<File> refused_;

  mutable Mutex mutex_;
  Condition changed_;
  /// Uses, ns, by inode: the last ones, and as many before them.
  std::unordered_map<std::uint64_t, std::int64_t> uses_ GUARDED_BY(mutex_);
  std::unordered_map<std::uint64_t, std::int64_t> usesBefore_ GUARDED_BY(mutex_);
  std::uint64_t total_ GUARDED_BY(mutex_) = 0;  ///< when last looked, less what was given up since
  std::uint64_t grown_ GUARDED_BY(mutex_) = 0;  ///< since then, at most
  bool hasChanged_ GUARDED_BY(mutex_) = false;  ///< since then
  bool isStuck_ GUARDED_BY(mutex_) = false;
  std::uint64_t looks_ GUARDED_BY(mutex_) = 0;
  Clock::time_point lastLook_ GUARDED_BY(mutex_);
  Clock::duration lookTook_ GUARDED_BY(mutex_){};
  Clock::time_point nextRetry_ GUARDED_BY(mutex_);
  Clock::duration retryPause_ GUARDED_BY(mutex_);
  bool isEnding_ GUARDED_BY(mutex_) = false;
  std::thread thread_;
};

}  // namespace yomber
