#pragma once

#include <functional>
#include <memory>

#include "platform/foundation/error.h"
#include "platform/foundation/lock.h"

namespace yomber {

/// A call without content, made again when there was reason to while it was on its way, and never
/// twice at a time: a peer that is slow to answer is owed at most one more.
///
/// Ownership: shared. Thread-safety: every operation may be called on any thread.
class CoalescedCall : public std::enable_shared_from_this<CoalescedCall> {
 public:
  /// Makes the call; runs `answered` once, later.
  using Send = std::function<void(std::function<void(NSErrorRef)> answered)>;

  explicit CoalescedCall(Send send) : send_(std::move(send)) {}

  void request();

 private:
  void answered();

  const Send send_;
  Mutex mutex_;
  bool isOnItsWay_ GUARDED_BY(mutex_) = false;
  bool isDueAgain_ GUARDED_BY(mutex_) = false;
};

}  // namespace yomber
