#pragma once

#include "platform/fileprovider/item.h"

namespace yomber {

/// "document", "folder", "alias", "bookmark" or "symlink": as the command line prints it and the
/// trash stores it. "document" for what is none of the kinds.
[[nodiscard]] const char* itemKindName(ItemKind kind);

}  // namespace yomber
