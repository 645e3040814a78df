#pragma once

#include <csignal>

namespace yomber {

/// Blocks the signals that end a process (SIGTERM, SIGINT, SIGHUP), in the calling thread and every
/// thread that is started from now on, so that one of them can wait for these; ignores SIGPIPE.
/// Answers the signals.
[[nodiscard]] sigset_t blockEndingSignals();

}  // namespace yomber
