#pragma once

#include <chrono>

#include "platform/ipc/patience.h"
#include "platform/ipc/remote.h"
#include "protocols/daemon.capnp.h"

namespace yomber {

/// How long the daemon may take for an answer that is no work: 30 seconds, or
/// YOMBER_DAEMON_TIMEOUT_MS milliseconds.
[[nodiscard]] std::chrono::milliseconds daemonTimeLimit();

/// What a daemon that is not stuck answers at once.
[[nodiscard]] ipc::Patience::Question questionForDaemon(ipc::Remote<protocol::Daemon> daemon);

}  // namespace yomber
