#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <thread>

#include "platform/foundation/error.h"
#include "platform/foundation/lock.h"

namespace yomber {

/// Decides when a database's log is written back to the database, and does it beside the writer: it
/// waits for the disk, and commits must not.
///
/// That is when the log has grown long, and when commits pause: pages that are in the log are found
/// by searching its index and copied out of it, so that reading a drive at rest would cost twice as
/// much while they stay there.
///
/// Thread-safety: `didCommit` on the writer's thread, `start` and `end` on any other.
class Checkpointer {
 public:
  /// Writes back what it can without waiting for anybody.
  using WriteBack = std::function<NSErrorRef()>;

  Checkpointer() = default;
  Checkpointer(const Checkpointer&) = delete;
  Checkpointer& operator=(const Checkpointer&) = delete;

  /// `writeBack` is called on a thread of its own until `end` has returned.
  void start(WriteBack writeBack);
  void end();

  /// The writer has committed, and the log has so many pages now. True when the writer is to write
  /// it back itself, before it goes on.
  [[nodiscard]] bool didCommit(int logPages);

 private:
  void run();
  bool waitUntilDue();

  WriteBack writeBack_;
  Mutex mutex_;
  Condition changed_;
  std::uint64_t commits_ GUARDED_BY(mutex_) = 0;
  bool isLong_ GUARDED_BY(mutex_) = false;     ///< to be written back at once
  bool isPending_ GUARDED_BY(mutex_) = false;  ///< to be written back when commits pause
  bool isNearlyWrittenBack_ GUARDED_BY(mutex_) = false;
  bool isEnding_ GUARDED_BY(mutex_) = false;
  std::thread thread_;
};

}  // namespace yomber
