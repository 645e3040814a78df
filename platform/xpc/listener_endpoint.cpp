#include "platform/xpc/listener_endpoint.h"

#include <utility>

namespace yomber {

void ListenerSettlement::settle() {
  std::vector<std::function<void()>> due;
  {
    LockGuard guard(mutex_);
    settled_ = true;
    due.swap(handlers_);
  }
  for (const auto& handler : due) handler();
}

void ListenerSettlement::whenSettled(std::function<void()> handler) {
  {
    LockGuard guard(mutex_);
    if (!settled_) {
      handlers_.push_back(std::move(handler));
      return;
    }
  }
  handler();
}

void NSXPCListenerEndpoint::whenSettled(std::function<void()> handler) const {
  if (settlement_ == nullptr) return handler();
  settlement_->whenSettled(std::move(handler));
}

ipc::UniqueFd NSXPCListenerEndpoint::takeSocket() {
  LockGuard guard(mutex_);
  return std::move(socket_);
}

int NSXPCListenerEndpoint::descriptor() const {
  LockGuard guard(mutex_);
  return socket_.get();
}

}  // namespace yomber
