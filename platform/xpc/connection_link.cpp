#include "platform/xpc/connection_link.h"

#include <string>

#include "platform/foundation/log.h"
#include "platform/ipc/call.h"
#include "platform/ipc/error_codec.h"
#include "platform/xpc/served_progress.h"

namespace yomber {

using protocol::ServicePeer;

/// What the other side sees here: the object that is offered, and what belongs to the connection.
class ConnectionLink::Peer final : public ServicePeer::Server {
 public:
  Peer(std::shared_ptr<ConnectionLink> link, kj::Own<capnp::Capability::Server> object)
      : link_(std::move(link)), object_(kj::mv(object)) {}

  DispatchCallResult dispatchCall(
      std::uint64_t interfaceId, std::uint16_t methodId,
      capnp::CallContext<capnp::AnyPointer, capnp::AnyPointer> context) override {
    if (object_.get() == nullptr || interfaceId == capnp::typeId<ServicePeer>()) {
      return ServicePeer::Server::dispatchCall(interfaceId, methodId, context);
    }
    return object_->dispatchCall(interfaceId, methodId, context);
  }

 protected:
  kj::Promise<void> goodbye(GoodbyeContext /*context*/) override {
    link_->didHearGoodbye();
    return kj::READY_NOW;
  }
  kj::Promise<void> cancel(CancelContext context) override {
    link_->cancelServed(context.getParams().getCall());
    return kj::READY_NOW;
  }
  kj::Promise<void> progressed(ProgressedContext context) override {
    const auto params = context.getParams();
    link_->setProgress(params.getCall(), params.getTotalUnits(), params.getCompletedUnits());
    return kj::READY_NOW;
  }

 private:
  const std::shared_ptr<ConnectionLink> link_;
  kj::Own<capnp::Capability::Server> object_;
};

ConnectionLink::ConnectionLink() : queue_(SerialQueue::create("xpc-connection")) {}

void ConnectionLink::setEndHandler(std::function<void(bool)> handler) {
  LockGuard guard(mutex_);
  endHandler_ = std::move(handler);
}

ipc::Connection::Ref ConnectionLink::connection() const {
  LockGuard guard(mutex_);
  return connection_;
}

capnp::Capability::Client ConnectionLink::otherSide() const {
  const auto connection = this->connection();
  if (connection == nullptr) {
    return kj::Exception(kj::Exception::Type::DISCONNECTED, __FILE__, __LINE__,
                         kj::heapString("The connection has ended."));
  }
  return connection->bootstrap<capnp::Capability>().client();
}

// ---- Beginning and end -------------------------------------------------------------------------

void ConnectionLink::open(ipc::UniqueFd socket, Socket kind, Serve serve) {
  const auto self = shared_from_this();
  opened_.store(true, std::memory_order_release);
  if (!socket) {
    ipc::EventLoop::shared().post([self] {
      self->beginEnd(End::Invalidated,
                     ipc::connectionError(NSXPCConnectionInvalid,
                                          "The endpoint was used before, or nobody listens there; "
                                          "ask for a new one."));
      self->finish();
    });
    return;
  }
  ipc::Connection::Bootstrap bootstrap = [self, serve = std::move(serve)] {
    kj::Own<capnp::Capability::Server> object;
    if (serve) object = serve();
    return capnp::Capability::Client(kj::heap<Peer>(self, kj::mv(object)));
  };
  if (kind == Socket::Checked) {
    const auto fd = std::make_shared<ipc::UniqueFd>(std::move(socket));
    ipc::EventLoop::shared().post([self, fd, bootstrap = std::move(bootstrap)]() mutable {
      self->attach(ipc::Connection::accepted(std::move(*fd), std::move(bootstrap)));
    });
    return;
  }
  NSErrorRef error;
  {
    // Held so that whatever the loop hears of the connection at once finds it here.
    LockGuard guard(mutex_);
    connection_ = ipc::Connection::adopt(socket.release(), std::move(bootstrap), &error);
  }
  ipc::EventLoop::shared().post([self, error] {
    if (error == nullptr) return self->attach(self->connection());
    self->beginEnd(End::Lost, error);
    self->finish();
  });
}

void ConnectionLink::attach(ipc::Connection::Ref connection) {
  {
    LockGuard guard(mutex_);
    connection_ = connection;
  }
  if (connection == nullptr) return;
  // Made before anything is read: what the other side sends may end the wire at any moment.
  peer_ = connection->bootstrap<ServicePeer>();
  (void)peer_.client();
  connection->onDisconnect(
      [self = shared_from_this()](const NSErrorRef& reason) { self->didDisconnect(reason); });
}

void ConnectionLink::invalidate() {
  ipc::EventLoop::shared().post([self = shared_from_this()] { self->endOnLoop(); });
}

bool ConnectionLink::beginEnd(End end, const NSErrorRef& reason) {
  if (end_ != End::None) return false;
  end_ = end;
  over_.store(true, std::memory_order_release);
  LockGuard guard(mutex_);
  endReason_ = reason;
  return true;
}

void ConnectionLink::endOnLoop() {
  if (!beginEnd(End::Invalidated,
                ipc::connectionError(NSXPCConnectionInvalid, "The connection was invalidated."))) {
    return;
  }
  const auto connection = this->connection();
  if (connection == nullptr || !peer_) return finish();
  auto farewell = peer_.client().goodbyeRequest().send().ignoreResult();
  ipc::EventLoop::shared().detach(farewell.catch_([](kj::Exception&&) {
    // The other side closes rather than answers.
  }));
  connection->close();
}

void ConnectionLink::didHearGoodbye() {
  if (!beginEnd(End::Goodbye, ipc::connectionError(NSXPCConnectionInvalid,
                                                   "The other side ended the connection."))) {
    return;
  }
  if (const auto connection = this->connection()) connection->close();
}

void ConnectionLink::didDisconnect(const NSErrorRef& reason) {
  (void)beginEnd(End::Lost, reason);
  // Calls that fail with the connection are told before its end.
  ipc::EventLoop::shared().detach(kj::evalLast([self = shared_from_this()] { self->finish(); }));
}

void ConnectionLink::finish() {
  if (std::exchange(finished_, true)) return;
  peer_ = nullptr;
  for (const auto& [call, each] : std::exchange(served_, {})) {
    if (const auto served = each.lock()) served->close();
  }
  std::function<void(bool)> handler;
  ipc::Connection::Ref connection;
  {
    LockGuard guard(mutex_);
    handler = std::exchange(endHandler_, nullptr);
    connection = std::exchange(connection_, nullptr);
    tracked_.clear();
  }
  if (!handler) return;
  queue_->async([handler = std::move(handler), wasLost = end_ == End::Lost] { handler(wasLost); });
}

NSErrorRef ConnectionLink::endError() const {
  std::string text = "The connection is not open.";
  LockGuard guard(mutex_);
  if (endReason_ != nullptr) text = endReason_->localizedDescription();
  return ipc::connectionError(NSXPCConnectionInvalid, std::move(text));
}

NSErrorRef ConnectionLink::explain(const NSErrorRef& error) const {
  const bool wasEndedOnPurpose = end_ == End::Goodbye || end_ == End::Invalidated;
  const bool isLoss = error->is(NSCocoaErrorDomain, NSXPCConnectionInterrupted);
  return wasEndedOnPurpose && isLoss ? endError() : error;
}

// ---- Progress ----------------------------------------------------------------------------------

ConnectionLink::TrackedProgress ConnectionLink::trackProgress() {
  /// What its user holds; the link forgets the call when it goes.
  struct Held {
    NSProgressRef progress;
    std::weak_ptr<ConnectionLink> link;
    std::uint64_t call = 0;
    ~Held() {
      const auto owner = link.lock();
      if (owner == nullptr) return;
      LockGuard guard(owner->mutex_);
      owner->tracked_.erase(call);
    }
  };
  const auto held = std::make_shared<Held>();
  held->progress = NSProgress::progressWithTotalUnitCount(0);
  held->link = weak_from_this();
  held->call = nextCall_.fetch_add(1);
  held->progress->setCancellationHandler([weak = weak_from_this(), call = held->call] {
    if (const auto self = weak.lock()) self->askToCancel(call);
  });
  NSProgressRef shown(held, held->progress.get());
  LockGuard guard(mutex_);
  tracked_[held->call] = std::make_shared<Tracked>(Tracked{.progress = shown});
  return {held->call, std::move(shown)};
}

void ConnectionLink::askToCancel(std::uint64_t call) {
  ipc::EventLoop::shared().post([self = shared_from_this(), call] {
    const auto connection = self->connection();
    if (connection == nullptr) return;
    if (!self->peer_) return;
    auto request = self->peer_.client().cancelRequest();
    request.setCall(call);
    ipc::EventLoop::shared().detach(request.send().ignoreResult().catch_(
        [](kj::Exception&&) { /* nothing to cancel there */ }));
  });
}

void ConnectionLink::setProgress(std::uint64_t call, std::int64_t total, std::int64_t completed) {
  std::shared_ptr<Tracked> tracked;
  {
    LockGuard guard(mutex_);
    const auto found = tracked_.find(call);
    if (found == tracked_.end()) return;
    tracked = found->second;
    tracked->total = total;
    tracked->completed = completed;
    if (std::exchange(tracked->isDue, true)) return;
  }
  queue_->async([self = shared_from_this(), tracked] { self->showProgress(tracked); });
}

void ConnectionLink::showProgress(const std::shared_ptr<Tracked>& tracked) {
  NSProgressRef progress;
  std::int64_t total = 0;
  std::int64_t completed = 0;
  {
    LockGuard guard(mutex_);
    tracked->isDue = false;
    progress = tracked->progress.lock();
    total = tracked->total;
    completed = tracked->completed;
  }
  if (progress == nullptr) return;
  progress->setTotalUnitCount(total);
  progress->setCompletedUnitCount(completed);
}

bool ConnectionLink::admitMessage() {
  if (waitingMessages_.fetch_add(1) < kMaximumWaitingMessages) return true;
  waitingMessages_.fetch_sub(1);
  return false;
}

std::shared_ptr<ServedProgress> ConnectionLink::serveProgress(std::uint64_t call) {
  auto served = std::make_shared<ServedProgress>(weak_from_this(), call);
  if (finished_) {
    served->close();
    return served;
  }
  auto& latest = served_[call];
  // Whoever uses a number again cannot cancel the earlier call any more.
  if (const auto earlier = latest.lock()) earlier->close();
  latest = served;
  return served;
}

void ConnectionLink::forgetServed(std::uint64_t call) {
  const auto found = served_.find(call);
  if (found != served_.end() && found->second.expired()) served_.erase(found);
}

void ConnectionLink::cancelServed(std::uint64_t call) {
  const auto found = served_.find(call);
  if (found == served_.end()) return;
  if (const auto served = found->second.lock()) served->cancel();
}

void ConnectionLink::tellProgress(std::uint64_t call, std::int64_t total, std::int64_t completed,
                                  std::function<void()> done) {
  const auto connection = this->connection();
  if (connection == nullptr || isOver() || !peer_) return done();
  auto request = peer_.client().progressedRequest();
  request.setCall(call);
  request.setTotalUnits(total);
  request.setCompletedUnits(completed);
  ipc::EventLoop::shared().detach(
      request.send().ignoreResult().then([done] { done(); }, [done](kj::Exception&&) { done(); }));
}

}  // namespace yomber
