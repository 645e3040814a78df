#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/foundation/error.h"
#include "zarn/file_descriptor.h"
#include "zarn/item_row.h"
#include "zarn/item_store.h"
#include "zarn/scanner.h"

namespace yomber {

/// An item that something is to be done with, and the folder in which it can be reached.
struct LocatedItem {
  ItemRow row;
  std::shared_ptr<const FileDescriptor> folder;  ///< open on what holds `name`
  std::string name;  ///< on this disk; "." for a place, whose own folder `folder` is
};

/// The row of what is at a location (logical or physical), right as of now. Otherwise nothing, with
/// QSOstrellErrorDomain 3 outside the tree, NSCocoaErrorDomain 512 in the drive's private places,
/// and NSCocoaErrorDomain 4 where there is no item.
[[nodiscard]] std::optional<ItemRow> findItemOnDisk(const ItemStore& store, Scanner& scanner,
                                                    std::string_view path, NSErrorRef* error);

/// The same, opened. NSCocoaErrorDomain 4 also when the item moves away again and again meanwhile.
[[nodiscard]] std::optional<LocatedItem> locateItem(const ItemStore& store, Scanner& scanner,
                                                    std::string_view path, NSErrorRef* error);

}  // namespace yomber
