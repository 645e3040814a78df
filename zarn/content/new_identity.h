#pragma once

#include <cstdint>

#include "platform/foundation/error.h"
#include "zarn/content/content_core.h"

namespace yomber {

/// Gives an item another id, as a record of somebody else's needs the one that it has. Nothing else
/// changes of it. A job makes its record anew; another one removes the record that it has, which
/// may just be being saved.
[[nodiscard]] NSErrorRef giveNewIdentity(ContentCore& core, std::uint64_t id);

}  // namespace yomber
