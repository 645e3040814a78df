#pragma once

#include <functional>
#include <memory>
#include <utility>

#include "platform/foundation/error.h"
#include "platform/foundation/lock.h"
#include "platform/foundation/serial_queue.h"

namespace yomber {

/// A proxy's error handler: called at most once, on the queue, and let go then.
///
/// Thread-safety: every operation may be called on any thread.
class ErrorHandlerSlot {
 public:
  ErrorHandlerSlot(std::function<void(NSErrorRef)> handler, std::shared_ptr<SerialQueue> queue)
      : queue_(std::move(queue)), handler_(std::move(handler)) {}

  void fail(const NSErrorRef& error) {
    std::function<void(NSErrorRef)> handler;
    {
      LockGuard guard(mutex_);
      handler = std::exchange(handler_, nullptr);
    }
    if (!handler) return;
    queue_->async([handler = std::move(handler), error] { handler(error); });
  }

 private:
  const std::shared_ptr<SerialQueue> queue_;
  Mutex mutex_;
  std::function<void(NSErrorRef)> handler_ GUARDED_BY(mutex_);
};

}  // namespace yomber
