#pragma once

#include <array>
#include <chrono>
#include <cstdint>
#include <deque>
#include <functional>
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
  /// `seq` is 0.
  void pushUrgent(std::uint64_t item);

  /// Waits for up to `limit` jobs of a kind, which nobody else gets until they are released. Empty
  /// once the queue ends.
  [[nodiscard]] std::vector<Job> take(JobKind kind, std::size_t limit);
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
    std::deque<Job> window;
    bool mayHaveMore = true;
    bool isReading = false;
    std::uint64_t notes = 0;              ///< how often rows were noted
    std::optional<std::int64_t> nextDue;  ///< of rows that are not due yet
    std::uint64_t blockedAt = ~0ULL;      ///< the release count when all that was due was taken
  };

  [[nodiscard]] bool isOpen(JobKind kind) const REQUIRES(mutex_);
  [[nodiscard]] bool hasWork(JobKind kind) const REQUIRES(mutex_);
  std::vector<Job> pick(JobKind kind, std::size_t limit) REQUIRES(mutex_);
  void claim(const Job& job, std::vector<Job>& taken) REQUIRES(mutex_);
  void refill(JobKind kind);
  void waitForWork(JobKind kind) REQUIRES(mutex_);
  [[nodiscard]] Lane& lane(JobKind kind) REQUIRES(mutex_) {
    return lanes_[static_cast<std::size_t>(kind)];
  }

  const std::shared_ptr<Database> database_;
  const Options options_;
  mutable Mutex mutex_;
  Condition changed_;
  std::array<Lane, kJobKinds> lanes_ GUARDED_BY(mutex_);
  std::deque<std::uint64_t> urgent_ GUARDED_BY(mutex_);
  std::unordered_map<std::uint64_t, Running> running_ GUARDED_BY(mutex_);
  std::uint64_t releases_ GUARDED_BY(mutex_) = 0;
  std::int64_t account_ GUARDED_BY(mutex_) = 0;
  bool isStoreOpen_ GUARDED_BY(mutex_) = false;
  bool isEnding_ GUARDED_BY(mutex_) = false;
};

}  // namespace yomber
