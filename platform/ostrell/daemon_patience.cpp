#include "platform/ostrell/daemon_patience.h"

#include <utility>

#include "platform/ostrell/daemon_question.h"

namespace yomber {

std::shared_ptr<ipc::Patience> daemonPatience(const std::shared_ptr<DaemonLink>& link,
                                              const DaemonSessionRef& session,
                                              std::function<void(NSErrorRef)> onStuck) {
  return std::make_shared<ipc::Patience>(link->callOptions().timeout,
                                         questionForDaemon(session->daemon()), std::move(onStuck));
}

}  // namespace yomber
