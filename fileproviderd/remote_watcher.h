#pragma once

#include <memory>

#include "fileproviderd/watcher_outbox.h"
#include "protocols/control.capnp.h"

namespace yomber {

/// A watcher in a client's process. What fails there counts as answered: when the client is gone,
/// its watch goes with its connection. Loop thread only.
[[nodiscard]] std::shared_ptr<ContainerWatcher> makeRemoteWatcher(protocol::Watcher::Client client);

}  // namespace yomber
