#include "platform/ipc/connection.h"

#include <capnp/rpc-twoparty.h>
#include <sys/socket.h>

#include <atomic>
#include <cerrno>
#include <utility>
#include <vector>

#include "platform/foundation/log.h"
#include "platform/foundation/thread_pool.h"
#include "platform/ipc/error_codec.h"
#include "platform/ipc/message_stream.h"

namespace yomber::ipc {

namespace {

using capnp::rpc::twoparty::Side;
using capnp::rpc::twoparty::VatId;

/// Calls that came in and were not answered may hold so much; then the peer is read no further.
constexpr std::uint64_t kMaximumUnansweredWords = 4 * kMaximumMessageWords;

capnp::ReaderOptions readerOptions() {
  return {.traversalLimitInWords = kMaximumMessageWords, .nestingLimit = 64};
}

/// What runs over a socket. Both ends are servers: that side listens at once, and which side an end
/// is shows nowhere in the messages.
struct Wire {
  Wire(UniqueFd socket, MessageStream::Handshake handshake,
       kj::Maybe<capnp::Capability::Client> own, MessageStream::OnEnd onEnd)
      : stream(EventLoop::shared().port(), std::move(socket), handshake, std::move(onEnd)),
        network(stream, kMaximumDescriptors, Side::SERVER, readerOptions()),
        rpc(network, kj::mv(own)) {
    rpc.setFlowLimit(kMaximumUnansweredWords);
    stream.limitBacklog([this] {
      return MessageStream::Backlog{network.getCurrentQueueSize(), network.getCurrentQueueCount()};
    });
  }

  capnp::Capability::Client bootstrap() {
    capnp::MallocMessageBuilder message;
    auto peer = message.initRoot<VatId>();
    peer.setSide(Side::CLIENT);
    return rpc.bootstrap(peer);
  }

  MessageStream stream;
  capnp::TwoPartyVatNetwork network;
  capnp::RpcSystem<VatId> rpc;
};

NSErrorRef closedHere() {
  return connectionError(NSXPCConnectionInvalid, "The connection was closed.");
}

}  // namespace

/// The connection as the loop thread knows it.
struct Connection::Link final : std::enable_shared_from_this<Link> {
  std::atomic<bool> connected{true};

  // Loop thread only.
  UniqueFd socket;  ///< until started
  MessageStream::Handshake handshake = MessageStream::Handshake::None;
  Bootstrap ownBootstrap;
  std::unique_ptr<Wire> wire;
  kj::Maybe<capnp::Capability::Client> peer;
  std::vector<std::function<void(NSErrorRef)>> handlers;
  NSErrorRef endReason;
  bool ending = false;  ///< the wire has ended, and the link will in a moment

  /// Does nothing when started or ended already.
  void start() {
    if (!socket || endReason) return;
    kj::Maybe<capnp::Capability::Client> own;
    if (ownBootstrap) own = std::exchange(ownBootstrap, nullptr)();
    // Whoever waits for the end has to hear of a socket that cannot be observed, too.
    KJ_IF_MAYBE (exception, kj::runCatchingExceptions([&] { makeWire(kj::mv(own)); })) {
      log_error(defaultLog(), "[ERROR] a connection cannot begin: %s",
                exception->getDescription().cStr());
      endSoon(weak_from_this(),
              connectionError(NSXPCConnectionInterrupted, exception->getDescription().cStr()));
    }
  }

  void makeWire(kj::Maybe<capnp::Capability::Client> own) {
    wire = std::make_unique<Wire>(std::move(socket), handshake, kj::mv(own),
                                  [this, weak = weak_from_this()](NSErrorRef reason) {
                                    ending = true;
                                    endSoon(weak, std::move(reason));
                                  });
  }

  /// Ends the link once all that the loop has in hand is done: it is called from inside the wire.
  static void endSoon(std::weak_ptr<Link> weak, NSErrorRef reason) {
    EventLoop::shared().detach(kj::evalLast([weak = std::move(weak), reason = std::move(reason)] {
      EventLoop::shared().post([weak, reason] {
        if (const auto link = weak.lock()) link->end(reason);
      });
    }));
  }

  /// From the loop's top level only.
  void end(NSErrorRef reason) {
    if (endReason) return;
    endReason = std::move(reason);
    connected = false;
    peer = nullptr;
    if (wire) wire->stream.flushNow();
    wire.reset();
    socket.reset();
    ownBootstrap = nullptr;
    for (auto& handler : std::exchange(handlers, {})) notify(handler);
  }

  void notify(std::function<void(NSErrorRef)>& handler) const {
    KJ_IF_MAYBE (exception, kj::runCatchingExceptions([&] { handler(endReason); })) {
      log_error(defaultLog(), "A disconnection handler failed: %s",
                exception->getDescription().cStr());
    }
  }

  capnp::Capability::Client peerCapability() {
    start();
    KJ_IF_MAYBE (known, peer) return *known;
    // A wire that has ended takes no new bootstrap: asked for one, it would end the process.
    if (!wire || ending) {
      return kj::Exception(kj::Exception::Type::DISCONNECTED, __FILE__, __LINE__,
                           kj::heapString("The connection has ended."));
    }
    return peer.emplace(wire->bootstrap());
  }
};

Connection::Connection(std::shared_ptr<Link> link) : link_(std::move(link)) {}

Connection::~Connection() { close(); }

Connection::Ref Connection::open(UniqueFd socket, bool proveUser, Bootstrap bootstrap) {
  std::shared_ptr<Link> link(new Link(), detail::DeleteOnLoop());
  link->socket = std::move(socket);
  link->handshake =
      proveUser ? MessageStream::Handshake::Credentials : MessageStream::Handshake::None;
  link->ownBootstrap = std::move(bootstrap);
  EventLoop& loop = EventLoop::shared();
  if (loop.isCurrent()) {
    link->start();
  } else {
    loop.post([link] { link->start(); });
  }
  return Ref(new Connection(std::move(link)));
}

Connection::Ref Connection::connect(const std::string& socketPath, NSErrorRef* error,
                                    Bootstrap bootstrap) {
  EventLoop::shared().assertElsewhere("Connection::connect");
  UniqueFd socket = connectUnixSocket(socketPath, error);
  if (!socket) return nullptr;
  return open(std::move(socket), false, std::move(bootstrap));
}

void Connection::connectAsync(const std::string& socketPath,
                              std::function<void(Ref, NSErrorRef)> handler, Bootstrap bootstrap) {
  ThreadPool::shared().async(
      [socketPath, handler = std::move(handler), bootstrap = std::move(bootstrap)] {
        NSErrorRef error;
        Ref connection = connect(socketPath, &error, bootstrap);
        handler(std::move(connection), std::move(error));
      });
}

Connection::Ref Connection::adopt(int fd, Bootstrap bootstrap, NSErrorRef* error) {
  UniqueFd socket(fd);
  if (const int number = MessageStream::sendCredentials(fd); number != 0) {
    storeError(error, number == EPIPE
                          ? connectionError(NSXPCConnectionInterrupted,
                                            "The peer closed its end before it was adopted.")
                          : NSError::errorWithErrno(number));
    return nullptr;
  }
  return open(std::move(socket), true, std::move(bootstrap));
}

Connection::Ref Connection::accepted(UniqueFd socket, Bootstrap bootstrap) {
  EventLoop::shared().assertCurrent("Connection::accepted");
  return open(std::move(socket), false, std::move(bootstrap));
}

capnp::Capability::Client Connection::peerBootstrap(Link& link) { return link.peerCapability(); }

void Connection::onDisconnect(std::function<void(NSErrorRef)> handler) {
  EventLoop::shared().post([link = link_, handler = std::move(handler)]() mutable {
    if (link->endReason) {
      link->notify(handler);
    } else {
      link->handlers.push_back(std::move(handler));
    }
  });
}

void Connection::close() {
  link_->connected = false;
  EventLoop::shared().post([link = link_] {
    EventLoop::shared().detach(
        kj::evalLast([link] { EventLoop::shared().post([link] { link->end(closedHere()); }); }));
  });
}

bool Connection::isConnected() const { return link_->connected; }

}  // namespace yomber::ipc
