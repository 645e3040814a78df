#pragma once

#include <optional>
#include <string>

#include <nlohmann/json_fwd.hpp>

#include "platform/rozzel/share.h"

namespace yomber {

/// The words of the command line for what somebody may do: "viewer", "editor", "none".
[[nodiscard]] const char* roleWord(RZShareParticipantPermission permission);
[[nodiscard]] std::optional<RZShareParticipantPermission> permissionForRole(
    const std::string& word);

/// "ann     owner     accepted", fit for a terminal, without the line's end.
[[nodiscard]] std::string participantLine(const RZShareParticipant& participant);
[[nodiscard]] nlohmann::ordered_json participantJson(const RZShareParticipant& participant);

/// What the share says, as lines of text, and as one object.
[[nodiscard]] std::string shareText(const RZShare& share);
[[nodiscard]] nlohmann::ordered_json shareJson(const RZShare& share);

}  // namespace yomber
