#pragma once

#include <functional>
#include <memory>
#include <utility>

#include "platform/foundation/error.h"
#include "platform/foundation/lock.h"
#include "platform/xpc/connection.h"

namespace yomber {

/// Waits on one thread for what comes on another, once.
class Completion {
 public:
  void settle(NSErrorRef error) {
    LockGuard guard(mutex_);
    if (std::exchange(isSettled_, true)) return;
    error_ = std::move(error);
    settled_.notifyAll();
  }
  [[nodiscard]] NSErrorRef wait() {
    LockGuard guard(mutex_);
    while (!isSettled_) settled_.wait(mutex_);
    return error_;
  }

 private:
  Mutex mutex_;
  Condition settled_;
  bool isSettled_ GUARDED_BY(mutex_) = false;
  NSErrorRef error_ GUARDED_BY(mutex_);
};

/// One service of one item, for a caller that waits for each reply. `Protocol` is the service's.
///
/// Thread-safety: one thread at a time.
template <typename Protocol>
class ServiceClient {
 public:
  using Done = std::function<void(NSErrorRef error)>;

  explicit ServiceClient(NSXPCConnectionRef connection) : connection_(std::move(connection)) {
    connection_->resume();
  }
  ~ServiceClient() { connection_->invalidate(); }
  ServiceClient(const ServiceClient&) = delete;
  ServiceClient& operator=(const ServiceClient&) = delete;

  /// Has `make` make a call, which is to call `done` with the reply's error. Answers that, or why
  /// there was no reply; one of both always comes.
  NSErrorRef call(const std::function<void(Protocol& service, const Done& done)>& make) {
    const auto completion = std::make_shared<Completion>();
    const Done done = [completion](NSErrorRef error) { completion->settle(std::move(error)); };
    const auto service = connection_->remoteObjectProxyWithErrorHandler<Protocol>(done);
    make(*service, done);
    return completion->wait();
  }

 private:
  const NSXPCConnectionRef connection_;
};

}  // namespace yomber
