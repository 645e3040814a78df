#pragma once

#include <functional>
#include <memory>
#include <utility>
#include <vector>

#include "platform/foundation/lock.h"
#include "platform/ipc/unix_socket.h"

namespace yomber {

/// Whether all who can connect to a listener have, or are gone. It outlives the listener.
///
/// Thread-safety: every operation may be called on any thread.
class ListenerSettlement {
 public:
  void settle();
  /// Calls `handler` once when it is settled, on any thread; at once when it is.
  void whenSettled(std::function<void()> handler);

 private:
  Mutex mutex_;
  bool settled_ GUARDED_BY(mutex_) = false;
  std::vector<std::function<void()>> handlers_ GUARDED_BY(mutex_);
};

class NSXPCListenerEndpoint;
using NSXPCListenerEndpointRef = std::shared_ptr<NSXPCListenerEndpoint>;

/// The way to one listener: one end of a socket pair. It cannot be guessed, and it is good for one
/// connection, in whatever process; a second one made from it is invalid at once.
///
/// Ownership: shared; the end is closed with it. Thread-safety: every operation may be called on
/// any thread.
class NSXPCListenerEndpoint final {
 public:
  /// Takes an end that came from another process, or none.
  explicit NSXPCListenerEndpoint(ipc::UniqueFd socket) : socket_(std::move(socket)) {}
  /// Of a listener of this process.
  NSXPCListenerEndpoint(ipc::UniqueFd socket, std::shared_ptr<ListenerSettlement> settlement)
      : settlement_(std::move(settlement)), socket_(std::move(socket)) {}
  NSXPCListenerEndpoint(const NSXPCListenerEndpoint&) = delete;
  NSXPCListenerEndpoint& operator=(const NSXPCListenerEndpoint&) = delete;

  /// Whether a connection can be made of it still.
  [[nodiscard]] bool isUsable() const { return descriptor() >= 0; }
  /// The end, to be connected; empty when it was taken before.
  ipc::UniqueFd takeSocket();
  /// To be sent along; -1 without one. It stays the endpoint's.
  [[nodiscard]] int descriptor() const;

  /// Calls `handler` once when nobody else will connect: the listener's delegate has answered, this
  /// end is gone everywhere, or the listener has ended. On any thread; at once for what came from
  /// another process.
  void whenSettled(std::function<void()> handler) const;

 private:
  const std::shared_ptr<ListenerSettlement> settlement_;
  mutable Mutex mutex_;
  ipc::UniqueFd socket_ GUARDED_BY(mutex_);
};

}  // namespace yomber
