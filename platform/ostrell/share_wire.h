#pragma once

#include <optional>
#include <vector>

#include "platform/foundation/error.h"
#include "platform/rozzel/share.h"
#include "protocols/sharing.capnp.h"

namespace yomber {

// Shares on the wire, for whoever sends or takes them. Whatever the peer sends, no more is taken
// than a share can have. Loop thread.

using WireParticipants = capnp::List<protocol::Share::Participant>;
void encodeParticipants(const std::vector<RZShareParticipant>& participants,
                        WireParticipants::Builder list);
/// Nothing for too many, and where a name is too long or missing. Numbers are taken as they are.
[[nodiscard]] std::optional<std::vector<RZShareParticipant>> decodeParticipants(
    WireParticipants::Reader list);

void encodeShare(const RZShare& share, protocol::Share::Builder builder);
/// Nil for what no share can be: unknown types, roles, permissions, statuses, too many
/// participants, names that are too long or missing, an owner who is not the first participant.
[[nodiscard]] RZShareRef decodeShare(protocol::Share::Reader reader);
/// Nil and an error when the daemon sent one, or no share.
[[nodiscard]] RZShareRef decodeShareResult(protocol::ShareResult::Reader reader, NSErrorRef* error);

}  // namespace yomber
