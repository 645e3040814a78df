#pragma once

#include <memory>

#include "fileproviderd/host.h"
#include "protocols/changes.capnp.h"

namespace yomber {

/// The extension's changes for a client: every call is passed on unread, and so is its answer. A
/// call is carried out to its end also when its client leaves. When the extension ends under it, it
/// fails; it is never made twice.
///
/// Loop thread only.
[[nodiscard]] protocol::Changes::Client makeChangeForwarder(std::shared_ptr<Host> host);

}  // namespace yomber
