#pragma once

#include <cstdint>
#include <memory>

#include "platform/foundation/lock.h"
#include "platform/foundation/progress.h"

namespace yomber {

class ConnectionLink;

/// The progress of a call that another process made: tells the caller of its counts, and is
/// cancelled for him.
///
/// One message about it is under way at a time; counts that change meanwhile are told together.
/// Ownership: shared by the call until it is answered, and by the progress. Keeps the progress
/// until the reply or the end of the connection, since the object need not: after that, it can be
/// cancelled for as long as somebody else holds it.
/// Thread-safety: any thread, unless it is said otherwise.
class ServedProgress final : public std::enable_shared_from_this<ServedProgress> {
 public:
  ServedProgress(std::weak_ptr<ConnectionLink> link, std::uint64_t call);
  ~ServedProgress();
  ServedProgress(const ServedProgress&) = delete;
  ServedProgress& operator=(const ServedProgress&) = delete;

  /// The call's method has answered this, or nil.
  void attach(const NSProgressRef& progress);
  /// The caller cancels, perhaps before the method was called. The handlers run on the pool.
  void cancel();
  /// Before the reply: what changed and was not told yet is told now.
  void willReply();
  /// Nobody will cancel any more.
  void close();

 private:
  void didChange();
  /// Loop thread only.
  void tell();

  const std::weak_ptr<ConnectionLink> link_;
  const std::uint64_t call_;

  Mutex mutex_;
  std::weak_ptr<NSProgress> progress_ GUARDED_BY(mutex_);
  NSProgressRef kept_ GUARDED_BY(mutex_);
  bool isClosed_ GUARDED_BY(mutex_) = false;
  std::int64_t total_ GUARDED_BY(mutex_) = 0;
  std::int64_t completed_ GUARDED_BY(mutex_) = 0;
  bool cancelled_ GUARDED_BY(mutex_) = false;
  bool changed_ GUARDED_BY(mutex_) = false;  ///< and nobody is on the way to the loop with it

  // Loop thread only.
  bool telling_ = false;
  bool stale_ = false;
};

}  // namespace yomber
