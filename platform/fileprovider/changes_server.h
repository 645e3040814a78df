#pragma once

#include <memory>

#include "platform/fileprovider/extension.h"
#include "protocols/changes.capnp.h"

namespace yomber {

/// Serves an extension's changes to the host. Every change runs on the thread pool, and to its end
/// also when nobody waits for it any more.
///
/// Thread-safety: loop thread only.
[[nodiscard]] protocol::Changes::Client serveChanges(
    std::shared_ptr<NSFileProviderExtension> extension);

}  // namespace yomber
