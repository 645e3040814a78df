#include "platform/xpc/listener.h"

#include <utility>

#include "platform/foundation/log.h"
#include "platform/ipc/awaited_peer.h"

namespace yomber {

NSXPCListener::NSXPCListener()
    : queue_(SerialQueue::create("xpc-listener")),
      settlement_(std::make_shared<ListenerSettlement>()) {}

NSXPCListener::~NSXPCListener() { settlement_->settle(); }

NSXPCListenerRef NSXPCListener::anonymousListener() {
  NSXPCListenerRef listener(new NSXPCListener());
  ipc::UniqueFd ours;
  ipc::UniqueFd theirs;
  NSErrorRef error;
  if (!ipc::makeSocketPair(ours, theirs, &error)) {
    log_error(defaultLog(), "[ERROR] no socket for a listener: %@", error);
  }
  LockGuard guard(listener->mutex_);
  listener->socket_ = std::move(ours);
  listener->unclaimed_ =
      std::make_shared<NSXPCListenerEndpoint>(std::move(theirs), listener->settlement_);
  listener->endpoint_ = listener->unclaimed_;
  return listener;
}

void NSXPCListener::setDelegate(std::weak_ptr<NSXPCListenerDelegate> delegate) {
  LockGuard guard(mutex_);
  delegate_ = std::move(delegate);
}

NSXPCListenerEndpointRef NSXPCListener::endpoint() {
  LockGuard guard(mutex_);
  auto given = endpoint_.lock();
  unclaimed_ = nullptr;
  return given;
}

void NSXPCListener::resume() {
  NSErrorRef error;
  {
    LockGuard guard(mutex_);
    if (!socket_ || invalidated_) return;
    awaited_ = ipc::AwaitedPeer::await(
        std::move(socket_),
        [weak = weak_from_this()](ipc::UniqueFd socket, const NSErrorRef& failure) {
          if (const auto self = weak.lock()) self->didHearFromPeer(std::move(socket), failure);
        },
        &error);
    if (awaited_ != nullptr) return;
  }
  log_info(defaultLog(), "[INFO] a listener cannot wait: %@", error);
  settlement_->settle();
}

void NSXPCListener::invalidate() {
  std::shared_ptr<ipc::AwaitedPeer> ended;
  ipc::UniqueFd socket;
  NSXPCListenerEndpointRef unclaimed;
  {
    LockGuard guard(mutex_);
    if (std::exchange(invalidated_, true)) return;
    ended = std::move(awaited_);
    socket = std::move(socket_);
    unclaimed = std::move(unclaimed_);
    delegate_.reset();
  }
  settlement_->settle();
}

bool NSXPCListener::isInvalidated() const {
  LockGuard guard(mutex_);
  return invalidated_;
}

void NSXPCListener::didHearFromPeer(ipc::UniqueFd socket, const NSErrorRef& error) {
  // Handlers and delegates never run on the loop thread, which this is.
  queue_->async([self = shared_from_this(), error,
                 fd = std::make_shared<ipc::UniqueFd>(std::move(socket))]() mutable {
    if (error == nullptr) self->accept(std::move(*fd));
    self->settlement_->settle();
  });
}

void NSXPCListener::accept(ipc::UniqueFd socket) {
  std::shared_ptr<NSXPCListenerDelegate> delegate;
  {
    LockGuard guard(mutex_);
    awaited_ = nullptr;
    delegate = delegate_.lock();
  }
  const auto connection = NSXPCConnection::accepted(std::move(socket));
  if (delegate == nullptr || !delegate->listener(shared_from_this(), connection)) {
    connection->invalidate();
  }
}

}  // namespace yomber
