#pragma once

#include <cstdint>
#include <memory>

#include "fileproviderd/host.h"
#include "protocols/control.capnp.h"

namespace yomber {

/// What a client of the control socket gets; `client`: its process. Loop thread only.
[[nodiscard]] protocol::Control::Client makeControlServer(std::shared_ptr<Host> host,
                                                          std::uint32_t client = 0);

}  // namespace yomber
