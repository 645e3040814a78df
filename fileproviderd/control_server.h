#pragma once

#include <memory>

#include "fileproviderd/host.h"
#include "protocols/control.capnp.h"

namespace yomber {

/// What a client of the control socket gets. Loop thread only.
[[nodiscard]] protocol::Control::Client makeControlServer(std::shared_ptr<Host> host);

}  // namespace yomber
