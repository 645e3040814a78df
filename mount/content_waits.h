#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "mount/content_requests.h"
#include "mount/fuse.h"
#include "mount/node_table.h"
#include "platform/foundation/lock.h"

namespace yomber {

/// Requests that wait for content. Those of one file wait together. Any signal interrupts them, and
/// who was interrupted by one that means nothing asks again: so content goes on being asked for a
/// little longer than somebody waits for it.
///
/// Thread-safety: every operation may be called on any thread.
class ContentWaits {
 public:
  explicit ContentWaits(std::shared_ptr<ContentRequests> requests)
      : requests_(std::move(requests)) {}
  ~ContentWaits();
  ContentWaits(const ContentWaits&) = delete;
  ContentWaits& operator=(const ContentWaits&) = delete;

  /// Called once, on a thread of the pool, with 0 or an errno: EINTR when whoever waits was
  /// interrupted.
  using Then = std::function<void(int failure)>;
  /// For how long content is still asked for after the last who waited was interrupted.
  static constexpr std::chrono::seconds kComingBack{5};
  /// Asks for the content of `node`, which is at the location `path` of the drive.
  void wait(fuse_req_t request, NodeUse node, const std::string& path, Then then);
  /// Asks `ask` for it, where nobody else has asked for that of the node.
  using Ask = std::function<std::shared_ptr<ContentRequests::Request>(ContentRequests::Completion)>;
  void wait(fuse_req_t request, NodeUse node, const Ask& ask, Then then);

 private:
  struct Waiter {
    std::uint64_t number = 0;
    Then then;
  };
  struct File {
    NodeUse node;
    std::uint64_t round = 0;       ///< tells one asking from the next
    std::uint64_t lastWaiter = 0;  ///< the number of the one who came last
    std::shared_ptr<ContentRequests::Request> request;
    std::vector<Waiter> waiters;
  };

  static void interrupted(fuse_req_t request, void* number);
  void interrupt(std::uint64_t number);
  void dropSoon(const Node* node, std::uint64_t lastWaiter);
  void drop(const Node* node, std::uint64_t lastWaiter);
  void answer(const Node* node, std::uint64_t round, const NSErrorRef& error);

  const std::shared_ptr<ContentRequests> requests_;
  Mutex mutex_;
  std::map<const Node*, File> files_ GUARDED_BY(mutex_);
  std::uint64_t lastNumber_ GUARDED_BY(mutex_) = 0;
};

}  // namespace yomber
