#pragma once

#include <functional>
#include <memory>

#include "platform/fileprovider/extension.h"

namespace yomber {

/// The extension process: takes the socket inherited from the host (descriptor number in the
/// environment variable YOMBER_EXTENSION_FD), makes one extension object with `makeExtension`, routes
/// every request of the host to it on worker threads, and returns when the host has gone.
///
/// Answers the process's exit code: 0 when the host went away, 64 when the process was not started
/// by a host (with a line on standard error that says so).
int NSExtensionMain(int argc, char** argv,
                    const std::function<std::shared_ptr<NSFileProviderExtension>()>& makeExtension);

}  // namespace yomber
