#include "platform/ipc/patience.h"

#include "platform/ipc/error_codec.h"
#include "platform/ipc/event_loop.h"

namespace yomber::ipc {

void Patience::begin() {
  if (hasEnded_) return;
  EventLoop::shared().deadlines().set(deadline_, limit_, [weak = weak_from_this()] {
    if (const auto self = weak.lock()) self->ask();
  });
}

void Patience::end() {
  hasEnded_ = true;
  deadline_.clear();
  question_ = nullptr;
  onStuck_ = nullptr;
}

void Patience::ask() {
  if (hasEnded_) return;
  question_({.timeout = limit_}, [weak = weak_from_this()](const NSErrorRef& error) {
    if (const auto self = weak.lock()) self->didAsk(error);
  });
}

void Patience::didAsk(const NSErrorRef& error) {
  if (hasEnded_) return;
  if (!error) {
    begin();
  } else if (error->is(NSCocoaErrorDomain, NSXPCConnectionTimedOut)) {
    const auto onStuck = std::exchange(onStuck_, nullptr);
    if (onStuck) onStuck(error);
  }
  // Any other failure is the connection's, and ends the call itself.
}

}  // namespace yomber::ipc
