#pragma once

#include <cstdint>
#include <string>

#include "platform/ostrell/content_protocol.h"
#include "protocols/content.capnp.h"

namespace yomber {

// What the library knows of content, on the daemon's wire. For this room's sources only. Loop
// thread.

struct ContainerLocation {
  NSURLRef url;
  std::string displayName;
  std::uint64_t generation = 0;
  NSErrorRef error;
};

/// Nil and an error when the daemon sent one, or a path that is none.
[[nodiscard]] NSURLRef decodeLocation(protocol::Content::LocationResult::Reader reader,
                                      NSErrorRef* error);
/// Never without both a location and an error.
[[nodiscard]] ContainerLocation decodeContainerLocation(
    protocol::Content::ContainerLocationResults::Reader reader);
[[nodiscard]] QSContentState decodeContentState(protocol::Content::State::Reader reader);
/// Leaves out transfers whose location is none.
[[nodiscard]] QSTransfers decodeTransfers(protocol::Content::TransfersResults::Reader reader);

}  // namespace yomber
