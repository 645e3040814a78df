#pragma once

#include <memory>

#include "platform/foundation/error.h"
#include "platform/foundation/lock.h"
#include "platform/foundation/serial_queue.h"
#include "platform/ipc/unix_socket.h"
#include "platform/xpc/connection.h"
#include "platform/xpc/listener_endpoint.h"

namespace yomber::ipc {
class AwaitedPeer;
}

namespace yomber {

class NSXPCListener;
using NSXPCListenerRef = std::shared_ptr<NSXPCListener>;

/// Decides on who connects.
class NSXPCListenerDelegate {
 public:
  virtual ~NSXPCListenerDelegate() = default;
  /// Called on the listener's own queue. The connection does nothing before it is resumed; whoever
  /// answers false need not do more, and the client's connection becomes invalid.
  virtual bool listener(const NSXPCListenerRef& listener,
                        const NSXPCConnectionRef& shouldAcceptNewConnection) = 0;
};

/// Waits for the one client that its endpoint was given to.
///
/// The listener's half of the handshake waits in the socket as soon as it is resumed, so that a
/// client which connects waits for nobody. Who connects must be of our user: others are refused and
/// logged, and the delegate does not hear of them.
///
/// Ownership: shared; a listener that is dropped while it waits leaves its client with an
/// interrupted connection. Once a connection was accepted, that lives by itself.
/// Thread-safety: every operation may be called on any thread.
class NSXPCListener final : public std::enable_shared_from_this<NSXPCListener> {
 public:
  /// Never nil. Out of descriptors, its endpoint is not usable.
  static NSXPCListenerRef anonymousListener();
  ~NSXPCListener();
  NSXPCListener(const NSXPCListener&) = delete;
  NSXPCListener& operator=(const NSXPCListener&) = delete;

  void setDelegate(std::weak_ptr<NSXPCListenerDelegate> delegate);
  /// One and the same while somebody holds it; nil afterwards.
  NSXPCListenerEndpointRef endpoint();
  /// Begins to wait. Once.
  void resume();
  /// Waits no more. An accepted connection stays.
  void invalidate();
  [[nodiscard]] bool isInvalidated() const;

 private:
  NSXPCListener();
  void didHearFromPeer(ipc::UniqueFd socket, const NSErrorRef& error);
  void accept(ipc::UniqueFd socket);

  const std::shared_ptr<SerialQueue> queue_;
  const std::shared_ptr<ListenerSettlement> settlement_;

  mutable Mutex mutex_;
  std::weak_ptr<NSXPCListenerDelegate> delegate_ GUARDED_BY(mutex_);
  NSXPCListenerEndpointRef unclaimed_ GUARDED_BY(mutex_);  ///< until it is first asked for
  std::weak_ptr<NSXPCListenerEndpoint> endpoint_ GUARDED_BY(mutex_);
  ipc::UniqueFd socket_ GUARDED_BY(mutex_);  ///< until resumed
  std::shared_ptr<ipc::AwaitedPeer> awaited_ GUARDED_BY(mutex_);
  bool invalidated_ GUARDED_BY(mutex_) = false;
};

}  // namespace yomber
