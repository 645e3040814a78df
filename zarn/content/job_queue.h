#pragma once

#include <array>
#include <chrono>
#include <cstdint>
#include <deque>
#include <functional>
#include <limits>
#include <memory>
#include <optional>
#include <unordered_map>
#include <unordered_set>
#include <vector>

#include "platform/foundation/lock.h"
#include "platform/foundation/progress.h"
#include "zarn/content/content_rows.h"
#include "zarn/database.h"

namespace yomber {

/// Hands out the jobs of the database: in the order in which they fall due, those of one item one
/// after the other. Only a window of them is in memory.
///
/// Thread-safety: every operation may be called on any thread.
class JobQueue {
 public:
  struct Options {
    std::function<std::int64_t()> clock;  ///< ns since the epoch
    /// The longest wait before the clock is asked again; short where it is not the machine's.
    std::chrono::milliseconds tick{10'000};
  };
  JobQueue(std::shared_ptr<Database> database, Options options);

  /// Whose jobs are handed out.
  void setAccount(std::int64_t account);
  [[nodiscard]] std::int64_t account() const;
  /// Without a store to talk to, uploads and downloads of rows wait.
  void setStoreOpen(bool isOpen);
  /// Rows of that kind may have been added or become due.
  void noteJobs(JobKind kind);
  /// An item that somebody waits for: handed out as a download before all others, in any case; its
  /// `seq` is 0. `size` is that of its content.
  void pushUrgent(std::uint64_t item, std::uint64_t size);

  /// How much is handed to one worker at a time. No more than it does together: what is claimed
  /// waits for it, although others may have nothing to do.
  struct Portion {
    std::size_t jobs = 1;
    /// Of their documents together; a larger one comes alone.
    std::uint64_t bytes = std::numeric_limits<std::uint64_t>::max();
  };
  /// Waits for jobs of a kind, the next ones in their order, which nobody else gets until they are
  /// released. Empty once the queue ends.
  [[nodiscard]] std::vector<Job> take(JobKind kind, const Portion& portion);
  void release(const std::vector<Job>& jobs);
  /// Waits that long, or until the queue ends.
  void rest(std::chrono::milliseconds length);

  struct Running {
    Job job;
    NSProgressRef progress;  ///< in bytes
  };
  [[nodiscard]] std::optional<Running> running(std::uint64_t item) const;
  [[nodiscard]] std::vector<Running> allRunning() const;

  /// Makes every `take` answer nothing.
  void end();
  [[nodiscard]] bool isEnding() const;
  /// Whether nothing is being done and nothing could be. Waits for it until `deadline`.
  [[nodiscard]] bool waitUntilIdle(std::chrono::steady_clock::time_point deadline);

 private:
  struct Lane {
    Condition changed;  ///< whoever takes some wakes the next while there are more
    std::deque<Job> window;
    bool mayHaveMore = true;
    bool isReading = false;
    std::uint64_t notes = 0;              ///< how often rows were noted
    std::optional<std::int64_t> nextDue;  ///< of rows that are not due yet
    std::uint64_t blockedAt = ~0ULL;      ///< the release count when all that was due was taken
  };

  [[nodiscard]] bool isOpen(JobKind kind) const REQUIRES(mutex_);
  [[nodiscard]] bool hasWork(JobKind kind) const REQUIRES(mutex_);
  class Taking;
  std::vector<Job> pick(JobKind kind, const Portion& portion) REQUIRES(mutex_);
  void pickUrgent(Taking& taking) REQUIRES(mutex_);
  void wakeAll() REQUIRES(mutex_);
  void refill(JobKind kind);
  void waitForWork(JobKind kind) REQUIRES(mutex_);
  [[nodiscard]] Lane& lane(JobKind kind) REQUIRES(mutex_) {
    return lanes_[static_cast<std::size_t>(kind)];
  }

  const std::shared_ptr<Database> database_;
  const Options options_;
  mutable Mutex mutex_;
  Condition released_;
  Condition ended_;
  std::array<Lane, kJobKinds> lanes_ GUARDED_BY(mutex_);
  std::deque<Job> urgent_ GUARDED_BY(mutex_);
  std::unordered_set<std::uint64_t> urgentItems_ GUARDED_BY(mutex_);  ///< those in `urgent_`
  std::unordered_map<std::uint64_t, Running> running_ GUARDED_BY(mutex_);
  std::uint64_t releases_ GUARDED_BY(mutex_) = 0;
  std::int64_t account_ GUARDED_BY(mutex_) = 0;
  bool isStoreOpen_ GUARDED_BY(mutex_) = false;
  bool isEnding_ GUARDED_BY(mutex_) = false;
};

}  // namespace yomber
