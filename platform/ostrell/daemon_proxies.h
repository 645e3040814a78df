#pragma once

#include <functional>
#include <memory>

#include "platform/ostrell/daemon_connection.h"
#include "platform/ostrell/daemon_link.h"

namespace yomber {

// The two proxies of the daemon. For this room's sources only.

[[nodiscard]] QSDaemonProxyRef makeDaemonProxy(std::shared_ptr<DaemonLink> link,
                                               std::function<void(NSErrorRef)> errorHandler);
[[nodiscard]] QSDaemonSyncProxyRef makeDaemonSyncProxy(std::shared_ptr<DaemonLink> link);

}  // namespace yomber
