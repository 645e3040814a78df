#pragma once

#include <utility>

#include "platform/foundation/lock.h"
#include "platform/ipc/call.h"

namespace yomber {

/// The call under way of an operation, which a cancellation may meet at any point. For this room's
/// sources only.
///
/// Thread-safety: every operation may be called on any thread.
class CancellableCall {
 public:
  /// Keeps the call, or gives it up when it was cancelled before it could be kept.
  void keep(ipc::CallHandle handle) {
    {
      LockGuard guard(mutex_);
      if (!isCancelled_) {
        handle_ = std::move(handle);
        return;
      }
    }
    handle.cancel();
  }
  void cancel() {
    ipc::CallHandle handle;
    {
      LockGuard guard(mutex_);
      isCancelled_ = true;
      handle = std::exchange(handle_, {});
    }
    handle.cancel();
  }
  bool isCancelled() {
    LockGuard guard(mutex_);
    return isCancelled_;
  }

 private:
  Mutex mutex_;
  bool isCancelled_ GUARDED_BY(mutex_) = false;
  ipc::CallHandle handle_ GUARDED_BY(mutex_);
};

}  // namespace yomber
