#include "platform/ostrell/daemon_patience.h"

#include "platform/ipc/call.h"
#include "platform/ipc/event_loop.h"

namespace yomber {

void DaemonPatience::begin() {
  if (hasEnded_) return;
  ipc::EventLoop::shared().deadlines().set(deadline_, link_->callOptions().timeout,
                                           [weak = weak_from_this()] {
                                             if (const auto self = weak.lock()) self->ask();
                                           });
}

void DaemonPatience::end() {
  hasEnded_ = true;
  deadline_.clear();
  onStuck_ = nullptr;
}

void DaemonPatience::ask() {
  using Results = protocol::Daemon::DescribeResults;
  (void)ipc::call(
      session_->daemon(), &protocol::Daemon::Client::describeRequest, [](auto) {},
      [weak = weak_from_this()](const NSErrorRef& error, const Results::Reader*) {
        if (const auto self = weak.lock()) self->didAsk(error);
      },
      link_->callOptions());
}

void DaemonPatience::didAsk(const NSErrorRef& error) {
  if (hasEnded_) return;
  if (!error) {
    begin();
  } else if (error->is(NSCocoaErrorDomain, NSXPCConnectionTimedOut)) {
    const auto onStuck = std::exchange(onStuck_, nullptr);
    if (onStuck) onStuck(error);
  }
  // Any other failure is the connection's, and ends the call itself.
}

}  // namespace yomber
