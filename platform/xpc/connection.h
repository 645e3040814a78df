#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <type_traits>
#include <typeinfo>
#include <utility>

#include "platform/foundation/error.h"
#include "platform/foundation/lock.h"
#include "platform/ipc/unix_socket.h"
#include "platform/xpc/interface.h"
#include "platform/xpc/listener_endpoint.h"
#include "platform/xpc/proxy_creating.h"

namespace yomber {

class ConnectionLink;
class NSXPCConnection;
using NSXPCConnectionRef = std::shared_ptr<NSXPCConnection>;

/// One connection between a client and a listener: each side may offer an object, and call that of
/// the other.
///
/// Each connection has a serial queue. On it run, one after the other: the messages to the exported
/// object, in the order in which they were sent; the replies that proxies get; their error
/// handlers; and the two handlers below. Replies that an exported object gives may come on any
/// thread, in any order, and are dropped when the connection has gone meanwhile; work that was
/// begun goes on. Messages beyond 10,000 that wait for an object fail with
/// NSXPCConnectionReplyInvalid.
///
/// How it ends, in whatever way, it ends once and for all:
/// - `invalidate`, on either side: the invalidation handler of both sides is called.
/// - Otherwise (the other process died, or broke the protocol): the interruption handler is called,
///   then the invalidation handler, whether or not the first invalidates the connection.
/// Each is called at most once. Calls that were not answered by then end with their proxy's error
/// handler: NSXPCConnectionInterrupted when the other side was lost under them, else
/// NSXPCConnectionInvalid.
///
/// Ownership: shared. Proxies and calls under way keep it. Dropping the last reference invalidates
/// it, without calling handlers. A connection that was accepted keeps itself from `resume` until it
/// ends, and with it the exported object and the handlers.
/// Thread-safety: every operation may be called on any thread.
class NSXPCConnection final : public std::enable_shared_from_this<NSXPCConnection> {
 public:
  using ErrorHandler = std::function<void(NSErrorRef error)>;

  /// Uses the endpoint up, when it is resumed.
  static NSXPCConnectionRef initWithListenerEndpoint(NSXPCListenerEndpointRef endpoint);
  ~NSXPCConnection();
  NSXPCConnection(const NSXPCConnection&) = delete;
  NSXPCConnection& operator=(const NSXPCConnection&) = delete;

  // Before `resume`.

  void setExportedInterface(NSXPCInterfaceRef interface);
  /// `Protocol` is the exported interface's: setExportedObject<QSSharingServiceV1>(object).
  template <typename Protocol>
  void setExportedObject(std::shared_ptr<std::type_identity_t<Protocol>> object) {
    setExported(typeid(Protocol), std::move(object));
  }
  void setRemoteObjectInterface(NSXPCInterfaceRef interface);

  void setInvalidationHandler(std::function<void()> handler);
  void setInterruptionHandler(std::function<void()> handler);

  /// Connects, or lets messages in. Once; it waits for nobody.
  void resume();
  /// Ends the connection and says so to the other side. Replies that were given before are sent.
  void invalidate();

  /// Calls the other side's object. For each call either the reply is called or, in its place,
  /// `errorHandler` (which may be empty); never both. A method that the other side leaves out is
  /// NSXPCConnectionReplyInvalid, and the connection stays. Calls have no time limit.
  ///
  /// A method that answers a progress answers one at once: its counts follow those of the other
  /// side, should that have one, and cancelling it cancels that. The counts are set, and its update
  /// handler is called, on the connection's queue, the last ones before the reply. Nil when the
  /// remote interface is not that of `Protocol`.
  template <typename Protocol>
  std::shared_ptr<Protocol> remoteObjectProxyWithErrorHandler(ErrorHandler errorHandler) {
    return std::static_pointer_cast<Protocol>(makeProxy(typeid(Protocol), std::move(errorHandler)));
  }

  /// For codings and listeners.
  [[nodiscard]] const std::shared_ptr<ConnectionLink>& link() const { return link_; }
  /// Of a socket whose peer was checked. Not resumed.
  static NSXPCConnectionRef accepted(ipc::UniqueFd socket);

 private:
  enum class State : std::uint8_t { Made, Resumed, Ended };

  NSXPCConnection();
  void setExported(const std::type_info& protocol, std::shared_ptr<void> object);
  std::shared_ptr<void> makeProxy(const std::type_info& protocol, ErrorHandler errorHandler);
  void open() REQUIRES(mutex_);
  void didEnd(bool wasInterrupted);

  const std::shared_ptr<ConnectionLink> link_;

  Mutex mutex_;
  State state_ GUARDED_BY(mutex_) = State::Made;
  NSXPCListenerEndpointRef endpoint_ GUARDED_BY(mutex_);
  ipc::UniqueFd accepted_ GUARDED_BY(mutex_);
  NSXPCInterfaceRef exportedInterface_ GUARDED_BY(mutex_);
  const std::type_info* exportedProtocol_ GUARDED_BY(mutex_) = nullptr;
  std::shared_ptr<void> exportedObject_ GUARDED_BY(mutex_);
  NSXPCInterfaceRef remoteInterface_ GUARDED_BY(mutex_);
  std::function<void()> invalidationHandler_ GUARDED_BY(mutex_);
  std::function<void()> interruptionHandler_ GUARDED_BY(mutex_);
  NSXPCConnectionRef self_ GUARDED_BY(mutex_);  ///< of one that was accepted, until it ends
};

}  // namespace yomber
