#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "mount/download_watch.h"
#include "platform/foundation/error.h"
#include "platform/foundation/lock.h"
#include "platform/ipc/connection.h"
#include "platform/ipc/remote.h"
#include "protocols/control.capnp.h"

namespace yomber {

/// What the mount asks the host: for content, and what a move needs.
///
/// Every answer comes, and comes once, on a thread of the pool: a host that has ended is waited for
/// (it is started again), but not for long, one that is stuck is noticed, and who wants content of
/// which nothing comes any more is told (EIO). Locations are those that the drive has, inside its
/// tree. Thread-safety: every operation may be called on any thread.
class ContentRequests : public std::enable_shared_from_this<ContentRequests> {
 public:
  /// For how long a host that is not there, or does not answer, is waited for.
  static constexpr std::chrono::seconds kPatience{15};

  /// `watch` tells when nothing comes any more.
  static std::shared_ptr<ContentRequests> create(std::string controlSocket,
                                                 std::shared_ptr<DownloadWatch> watch);
  ContentRequests(const ContentRequests&) = delete;
  ContentRequests& operator=(const ContentRequests&) = delete;

  using Completion = std::function<void(const NSErrorRef& error)>;
  /// A request that is under way; dropping it takes it back: the completion is told of a
  /// cancellation, if it was not called before.
  class Request {
   public:
    virtual ~Request() = default;
  };
  /// Does not wait.
  [[nodiscard]] std::shared_ptr<Request> provide(const std::string& path, Completion completion);

  /// Waits for the answer. Whether the content has to be here before the item is moved.
  [[nodiscard]] NSErrorRef movingItem(const std::string& path, const std::string& destination,
                                      bool& requiresProviding);
  /// The content was written. Not answered.
  void itemChanged(const std::string& path);
  /// Waits for the answer: nobody needs the content any more.
  [[nodiscard]] NSErrorRef stopProviding(const std::string& path);

 private:
  class Providing;

  ContentRequests(std::string controlSocket, std::shared_ptr<DownloadWatch> watch)
      : controlSocket_(std::move(controlSocket)), watch_(std::move(watch)) {}
  /// Waits while it is made.
  ipc::Remote<protocol::Control> control(NSErrorRef* error);
  using ControlHandler = std::function<void(ipc::Remote<protocol::Control>, NSErrorRef)>;
  /// Calls `handler` when the host is connected, or cannot be: at once, or on a thread of the pool.
  /// However many wait, one connection is made.
  void withControl(const ControlHandler& handler);
  void didConnect(const ipc::Connection::Ref& connection, const NSErrorRef& error);
  void dropConnection();

  const std::string controlSocket_;
  const std::shared_ptr<DownloadWatch> watch_;
  Mutex mutex_;
  ipc::Connection::Ref connection_ GUARDED_BY(mutex_);
  std::vector<ControlHandler> waiting_ GUARDED_BY(mutex_);  ///< while a connection is being made
};

/// The errno for an application that cannot have what it asked for.
[[nodiscard]] int errnoOf(const NSErrorRef& error);

}  // namespace yomber
