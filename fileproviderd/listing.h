#pragma once

#include <chrono>
#include <functional>
#include <string>

#include "fileproviderd/extension_supervisor.h"
#include "platform/foundation/error.h"
#include "protocols/control.capnp.h"

namespace yomber {

/// Says what is behind an error in words for a person; may ask zarn. Calls its handler once.
using ErrorExplainer =
    std::function<void(const NSErrorRef& error, std::function<void(NSErrorRef)> handler)>;

/// A listing for a client: every `next` answers one page of the extension, passed on unread. One
/// page is asked for ahead of the client, so that extension, zarn and client work side by side.
/// Calls of `next` that overtake the pages wait in order, a few at most.
///
/// Loop thread only. `explain` must keep `supervisor` alive.
[[nodiscard]] protocol::Listing::Client makeListing(ExtensionSupervisor& supervisor,
                                                    ErrorExplainer explain, std::string container,
                                                    protocol::SortOrder order,
                                                    std::chrono::milliseconds pageLimit);

}  // namespace yomber
