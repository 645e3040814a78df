#pragma once

#include <capnp/capability.h>

#include <cstddef>
#include <functional>
#include <memory>
#include <string>

#include "platform/foundation/error.h"
#include "platform/ipc/unix_socket.h"

namespace yomber::ipc {

/// A listening Unix socket, mode 0600, that serves a capability to each peer of our own user.
///
/// A peer of another user is closed at once and logged; so is a peer beyond the limit. When the
/// process is out of descriptors, accepting pauses and resumes.
///
/// Destroying it (not necessarily where it was made; on any thread) closes the socket and every
/// accepted connection, and removes the path if it is still its own; no factory call runs after.
class Listener {
 public:
  struct Options {
    std::size_t maximumConnections = 256;
  };
  /// Makes the bootstrap capability of one accepted connection. Called on the loop thread.
  using Factory = std::function<capnp::Capability::Client(const PeerCredentials&)>;

  /// Nil with an error that names the path: when a live process answers there (it is left alone),
  /// when something that is no socket is in the way, or when the directory does not take a socket.
  /// A socket that nobody answers on is replaced. Not on the loop thread.
  static std::unique_ptr<Listener> listen(const std::string& path, Factory factory,
                                          NSErrorRef* error = nullptr);
  static std::unique_ptr<Listener> listen(const std::string& path, Factory factory, Options options,
                                          NSErrorRef* error = nullptr);
  ~Listener();
  Listener(const Listener&) = delete;
  Listener& operator=(const Listener&) = delete;

  [[nodiscard]] const std::string& path() const;
  /// How many accepted connections are open now.
  [[nodiscard]] std::size_t connectionCount() const;

 private:
  struct State;
  explicit Listener(std::shared_ptr<State> state);
  std::shared_ptr<State> state_;
};

}  // namespace yomber::ipc
