#pragma once

#include <functional>
#include <memory>

#include "platform/foundation/error.h"
#include "platform/ipc/patience.h"
#include "platform/ostrell/daemon_link.h"

namespace yomber {

/// Waits with a call of the session that takes as long as its work takes; its limit is the link's.
/// For this room's sources only.
[[nodiscard]] std::shared_ptr<ipc::Patience> daemonPatience(
    const std::shared_ptr<DaemonLink>& link, const DaemonSessionRef& session,
    std::function<void(NSErrorRef)> onStuck);

}  // namespace yomber
