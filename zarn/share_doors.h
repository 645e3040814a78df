#pragma once

#include <string_view>

#include "platform/foundation/error.h"
#include "zarn/item_row.h"
#include "zarn/item_store.h"

namespace yomber {

/// Nil when the item may be moved, trashed or deleted as far as shares go; otherwise
/// NSCocoaErrorDomain 513 that says whose it is and what to do. A shared item itself may: that is
/// leaving the share.
[[nodiscard]] NSErrorRef refusedByShare(const ItemStore& store, const ItemRow& row,
                                        std::string_view path);
/// The same for what is to come into a folder.
[[nodiscard]] NSErrorRef refusedInFolder(const ItemStore& store, const ItemRow& folder,
                                         std::string_view path);

}  // namespace yomber
