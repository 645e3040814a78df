#pragma once

#include <capnp/capability.h>

#include <functional>
#include <memory>
#include <string>

#include "platform/foundation/error.h"
#include "platform/ipc/remote.h"
#include "platform/ipc/unix_socket.h"

namespace yomber::ipc {

/// One connection to one peer process of the same user.
///
/// Either side may export a bootstrap capability, and descriptors travel on capabilities
/// (`capnp::Capability::Server::getFd`). A message is at most 64 MiB: a larger call fails alone, a
/// larger reply becomes an error for its caller alone, and a peer that sends one regardless, or
/// bytes that are no message, or reads nothing while much waits for it, is disconnected.
///
/// Dropping the last reference closes the connection. When it ends, every outstanding call on its
/// capabilities fails, once each.
///
/// Ownership: shared (`Ref`). Thread-safety: every operation may be called on any thread unless it
/// says otherwise.
class Connection {
 public:
  using Ref = std::shared_ptr<Connection>;
  /// Makes the capability that the peer gets from `bootstrap`. Called on the loop thread, once. May
  /// be empty: then the peer's calls on it fail.
  using Bootstrap = std::function<capnp::Capability::Client()>;

  /// Connects to the listener at `socketPath`, which must be of our own user. Nil with an error
  /// that names the path and says what to do when that fails. Not on the loop thread: it may wait a
  /// few seconds for a peer that is too busy to accept.
  static Ref connect(const std::string& socketPath, NSErrorRef* error = nullptr,
                     Bootstrap bootstrap = {});
  /// The same without waiting; `handler` is called once, on a pool thread.
  static void connectAsync(const std::string& socketPath,
                           std::function<void(Ref, NSErrorRef)> handler, Bootstrap bootstrap = {});
  /// Takes one end of a socket pair, and the descriptor with it. Both ends prove their user first:
  /// nothing is sent to, and nothing is parsed from, a peer that has not; a peer of another user is
  /// disconnected. Nil with an error when `fd` is no Unix stream socket.
  static Ref adopt(int fd, Bootstrap bootstrap = {}, NSErrorRef* error = nullptr);

  Connection(const Connection&) = delete;
  Connection& operator=(const Connection&) = delete;
  ~Connection();

  /// The capability that the peer exports. Keeps neither the connection open nor itself alive in
  /// it: once the connection is gone, its calls fail.
  template <typename Interface>
  [[nodiscard]] Remote<Interface> bootstrap() const {
    return Remote<Interface>([link = link_]() -> typename Interface::Client {
      return peerBootstrap(*link).template castAs<Interface>();
    });
  }

  /// Calls `handler` with the reason when the connection ends, or soon when it has ended. Called
  /// once, on the loop thread. The reason is never nil: interrupted when the peer went away,
  /// invalid when it was closed here, refused, or broke the protocol.
  void onDisconnect(std::function<void(NSErrorRef)> handler);
  /// Ends the connection. Replies that were complete before are still sent as far as the socket
  /// takes them at once.
  void close();
  [[nodiscard]] bool isConnected() const;

  /// What a Listener makes of an accepted and checked socket. Loop thread only.
  static Ref accepted(UniqueFd socket, Bootstrap bootstrap);

 private:
  struct Link;

  explicit Connection(std::shared_ptr<Link> link);
  static Ref open(UniqueFd socket, bool proveUser, Bootstrap bootstrap);
  static capnp::Capability::Client peerBootstrap(Link& link);

  std::shared_ptr<Link> link_;
};

}  // namespace yomber::ipc
