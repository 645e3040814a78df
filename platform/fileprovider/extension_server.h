#pragma once

#include <memory>

#include "platform/fileprovider/extension.h"
#include "protocols/extension.capnp.h"

namespace yomber {

/// The capability that serves `extension` to the host: every request runs on the thread pool, any
/// number at a time. Enumerators are invalidated when the host drops them, and all of them when the
/// connection ends.
///
/// Thread-safety: loop thread only.
[[nodiscard]] protocol::Extension::Client serveExtension(
    std::shared_ptr<NSFileProviderExtension> extension);

/// The page tokens that a listing can be asked for; longer ones are refused.
inline constexpr std::size_t kMaximumTokenLength = 4096;

}  // namespace yomber
