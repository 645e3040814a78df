#pragma once

#include <functional>
#include <memory>

#include "platform/foundation/error.h"
#include "platform/ipc/unix_socket.h"

namespace yomber::ipc {

/// One end of a socket pair whose other end was given away, until somebody speaks there.
///
/// Our own half of the handshake is sent at once and waits in the socket. Whoever speaks first has
/// to prove to be of our user; nothing else is read.
///
/// Dropping it closes the end. Thread-safety: made and dropped on any thread.
class AwaitedPeer {
 public:
  /// Called once, on the loop thread: with the checked socket, for Connection::accepted, or with
  /// why nobody will come: NSXPCConnectionInterrupted when all who had the other end are gone,
  /// NSXPCConnectionInvalid when who spoke was refused, or the socket cannot be waited at.
  using Handler = std::function<void(UniqueFd socket, NSErrorRef error)>;

  /// Nil with an error when `socket` is no Unix stream socket, or its other end is closed.
  static std::shared_ptr<AwaitedPeer> await(UniqueFd socket, Handler handler,
                                            NSErrorRef* error = nullptr);

  AwaitedPeer(const AwaitedPeer&) = delete;
  AwaitedPeer& operator=(const AwaitedPeer&) = delete;
  ~AwaitedPeer();

 private:
  struct State;
  explicit AwaitedPeer(std::shared_ptr<State> state);
  std::shared_ptr<State> state_;
};

}  // namespace yomber::ipc
