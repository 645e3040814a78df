#include "platform/ipc/awaited_peer.h"

#include <sys/socket.h>

#include <cerrno>
#include <string>
#include <utility>

#include "platform/foundation/log.h"
#include "platform/ipc/error_codec.h"
#include "platform/ipc/event_loop.h"
#include "platform/ipc/message_stream.h"
#include "platform/ipc/remote.h"

namespace yomber::ipc {

/// Loop thread only once started.
struct AwaitedPeer::State {
  UniqueFd socket;
  Handler handler;
  kj::Own<kj::UnixEventPort::FdObserver> observer;
  kj::Maybe<kj::Promise<void>> task;

  void start() {
    if (!socket) return;
    KJ_IF_MAYBE (exception, kj::runCatchingExceptions([this] { observe(); })) fail(*exception);
  }

  void observe() {
    observer = kj::heap<kj::UnixEventPort::FdObserver>(EventLoop::shared().port(), socket.get(),
                                                       kj::UnixEventPort::FdObserver::OBSERVE_READ);
    task = look().eagerlyEvaluate([this](kj::Exception&& exception) { fail(exception); });
  }

  void fail(const kj::Exception& exception) {
    const std::string why = exception.getDescription().cStr();
    log_error(defaultLog(), "[ERROR] waiting for a peer failed: %@", why);
    settle(connectionError(NSXPCConnectionInvalid, "Waiting for a peer failed: " + why));
  }

  kj::Promise<void> look() {
    // Armed before the look, so that nothing falls between the two.
    kj::Promise<void> ready = observer->whenBecomesReadable();
    std::string refusal;
    switch (MessageStream::receiveCredentials(socket.get(), refusal)) {
      case MessageStream::Proof::NotYet:
        return ready.then([this] { return look(); });
      case MessageStream::Proof::Given:
        settle(nullptr);
        break;
      case MessageStream::Proof::PeerLeft:
        settle(connectionError(NSXPCConnectionInterrupted, std::move(refusal)));
        break;
      case MessageStream::Proof::Refused:
        log_error(defaultLog(), "[ERROR] %@", refusal);
        // Also where the end was inherited by others.
        ::shutdown(socket.get(), SHUT_RDWR);
        settle(connectionError(NSXPCConnectionInvalid, std::move(refusal)));
        break;
    }
    return kj::READY_NOW;
  }

  /// Dropping the AwaitedPeer in the handler is safe: the state goes later.
  void settle(NSErrorRef error) {
    UniqueFd given = releaseSocket();
    if (error != nullptr) given.reset();
    const Handler called = std::exchange(handler, nullptr);
    if (called) called(std::move(given), std::move(error));
  }

  UniqueFd releaseSocket() {
    // Whoever takes it observes it anew.
    observer = nullptr;
    return std::move(socket);
  }

  void stop() {
    task = nullptr;
    observer = nullptr;
    socket.reset();
    handler = nullptr;
  }
};

AwaitedPeer::AwaitedPeer(std::shared_ptr<State> state) : state_(std::move(state)) {}

AwaitedPeer::~AwaitedPeer() {
  EventLoop::shared().post([state = state_] { state->stop(); });
}

std::shared_ptr<AwaitedPeer> AwaitedPeer::await(UniqueFd socket, Handler handler,
                                                NSErrorRef* error) {
  if (const int number = MessageStream::sendCredentials(socket.get()); number != 0) {
    storeError(error, number == EPIPE ? connectionError(NSXPCConnectionInterrupted,
                                                        "Nobody has the other end any more.")
                                      : NSError::errorWithErrno(number));
    return nullptr;
  }
  std::shared_ptr<State> state(new State(), detail::DeleteOnLoop());
  state->socket = std::move(socket);
  state->handler = std::move(handler);
  EventLoop::shared().post([state] { state->start(); });
  return std::shared_ptr<AwaitedPeer>(new AwaitedPeer(std::move(state)));
}

}  // namespace yomber::ipc
