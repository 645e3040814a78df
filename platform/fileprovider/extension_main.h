#pragma once

#include <functional>
#include <memory>

#include "platform/fileprovider/extension.h"

namespace yomber {

/// The descriptor of the socket to the host, in decimal.
inline constexpr const char* kExtensionDescriptorVariable = "YOMBER_EXTENSION_FD";

/// The extension process: takes the socket inherited from the host (descriptor number in the
/// environment variable YOMBER_EXTENSION_FD, which is taken out of the environment), makes one
/// extension object with `makeExtension`, routes every request of the host to it on worker threads,
/// and returns when the host has gone. While it runs, the default NSFileProviderManager signals
/// that host. The process dies with the thread that started it. Its log is "qs-fileprovider", of
/// the drive that YOMBER_HOME names.
///
/// Answers the process's exit code: 0 when the host went away, 64 when the process was not started
/// by a host (with a line on standard error that says so).
int NSExtensionMain(int argc, char** argv,
                    const std::function<std::shared_ptr<NSFileProviderExtension>()>& makeExtension);

}  // namespace yomber
