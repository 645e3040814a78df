#include "platform/xpc/connection.h"

#include <utility>

#include "platform/foundation/log.h"
#include "platform/xpc/connection_link.h"
#include "platform/xpc/interface_coding.h"

namespace yomber {

NSXPCConnection::NSXPCConnection() : link_(std::make_shared<ConnectionLink>()) {}

NSXPCConnection::~NSXPCConnection() { link_->invalidate(); }

NSXPCConnectionRef NSXPCConnection::initWithListenerEndpoint(NSXPCListenerEndpointRef endpoint) {
  NSXPCConnectionRef connection(new NSXPCConnection());
  LockGuard guard(connection->mutex_);
  connection->endpoint_ = std::move(endpoint);
  return connection;
}

NSXPCConnectionRef NSXPCConnection::accepted(ipc::UniqueFd socket) {
  NSXPCConnectionRef connection(new NSXPCConnection());
  LockGuard guard(connection->mutex_);
  connection->accepted_ = std::move(socket);
  return connection;
}

void NSXPCConnection::setExportedInterface(NSXPCInterfaceRef interface) {
  LockGuard guard(mutex_);
  exportedInterface_ = std::move(interface);
}

void NSXPCConnection::setExported(const std::type_info& protocol, std::shared_ptr<void> object) {
  LockGuard guard(mutex_);
  exportedProtocol_ = &protocol;
  exportedObject_ = std::move(object);
}

void NSXPCConnection::setRemoteObjectInterface(NSXPCInterfaceRef interface) {
  LockGuard guard(mutex_);
  remoteInterface_ = std::move(interface);
}

void NSXPCConnection::setInvalidationHandler(std::function<void()> handler) {
  LockGuard guard(mutex_);
  invalidationHandler_ = std::move(handler);
}

void NSXPCConnection::setInterruptionHandler(std::function<void()> handler) {
  LockGuard guard(mutex_);
  interruptionHandler_ = std::move(handler);
}

void NSXPCConnection::resume() {
  LockGuard guard(mutex_);
  if (state_ == State::Made) open();
}

void NSXPCConnection::open() {
  state_ = State::Resumed;
  const bool wasAccepted = static_cast<bool>(accepted_);
  if (wasAccepted) self_ = shared_from_this();
  link_->setEndHandler([weak = weak_from_this()](bool wasInterrupted) {
    if (const auto self = weak.lock()) self->didEnd(wasInterrupted);
  });
  ConnectionLink::Serve serve;
  if (exportedObject_ != nullptr && exportedInterface_ != nullptr) {
    if (*exportedProtocol_ == exportedInterface_->protocol()) {
      serve = [interface = exportedInterface_, object = exportedObject_, link = link_] {
        return interface->coding().serve(object, link);
      };
    } else {
      log_fault(defaultLog(), "[CRIT] an object is exported that is not of the exported interface");
    }
  }
  if (wasAccepted) {
    link_->open(std::move(accepted_), ConnectionLink::Socket::Checked, std::move(serve));
    return;
  }
  auto socket = endpoint_ != nullptr ? endpoint_->takeSocket() : ipc::UniqueFd();
  endpoint_ = nullptr;
  link_->open(std::move(socket), ConnectionLink::Socket::ToBeProved, std::move(serve));
}

void NSXPCConnection::invalidate() {
  LockGuard guard(mutex_);
  if (state_ == State::Ended) return;
  if (state_ == State::Made) {
    // Opened without an object, for the goodbye.
    exportedObject_ = nullptr;
    open();
  }
  link_->invalidate();
}

void NSXPCConnection::didEnd(bool wasInterrupted) {
  std::function<void()> interruption;
  std::function<void()> invalidation;
  std::shared_ptr<void> object;
  NSXPCConnectionRef self;
  {
    LockGuard guard(mutex_);
    state_ = State::Ended;
    interruption = std::move(interruptionHandler_);
    object = std::move(exportedObject_);
    self = std::move(self_);
  }
  if (wasInterrupted && interruption) interruption();
  {
    LockGuard guard(mutex_);
    invalidation = std::move(invalidationHandler_);
  }
  if (invalidation) invalidation();
}

std::shared_ptr<void> NSXPCConnection::makeProxy(const std::type_info& protocol,
                                                 ErrorHandler errorHandler) {
  NSXPCInterfaceRef interface;
  {
    LockGuard guard(mutex_);
    interface = remoteInterface_;
  }
  if (interface == nullptr || interface->protocol() != protocol) {
    log_fault(defaultLog(),
              "[CRIT] a proxy is wanted that is not of the remote object's interface");
    return nullptr;
  }
  return interface->coding().makeProxy(shared_from_this(), std::move(errorHandler));
}

}  // namespace yomber
