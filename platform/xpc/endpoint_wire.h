#pragma once

#include <functional>

#include "platform/ipc/remote.h"
#include "platform/xpc/listener_endpoint.h"
#include "protocols/services.capnp.h"

namespace yomber {

// Endpoints between processes. Not for extensions: this header shows Cap'n Proto types. Loop thread
// only.

/// A capability that carries the endpoint's descriptor and keeps the endpoint.
[[nodiscard]] protocol::ServiceEndpoint::Client serveEndpoint(NSXPCListenerEndpointRef endpoint);

/// The promise of the endpoint that the capability carries: with a descriptor of its own, so that
/// the capability may go. Not usable when there was none, or no descriptor is left.
[[nodiscard]] kj::Promise<NSXPCListenerEndpointRef> endpointOf(
    protocol::ServiceEndpoint::Client capability);

}  // namespace yomber
