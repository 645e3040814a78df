#pragma once

#include <cstdint>
#include <limits>

#include "platform/foundation/data.h"
#include "platform/foundation/uuid.h"

namespace yomber {

// Change tokens: the sync anchors of a folder's enumerator. 24 bytes: the rank (64 bits, native
// order) and the raw UUID of the generation that the rank counts in.

/// What an anchor of another generation reads as; -1 when read signed.
inline constexpr std::uint64_t kChangeTokenOfAnotherGeneration =
    std::numeric_limits<std::uint64_t>::max();

/// Never nil.
[[nodiscard]] NSDataRef qs_changeTokenFromRank(std::uint64_t rank, const UUID& uuid);
/// The rank of a token of the generation `uuid`. No length is checked: missing bytes read as 0. A
/// nil token reads as rank 0.
[[nodiscard]] std::uint64_t qs_changeTokenRankWithUUID(const NSDataRef& token, const UUID& uuid);

}  // namespace yomber
