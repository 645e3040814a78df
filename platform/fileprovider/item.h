#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/fileprovider/constants.h"
#include "platform/foundation/date.h"
#include "platform/foundation/object.h"

namespace yomber {

enum class ItemKind : std::uint8_t {
  Document = 0,
  Folder = 1,
  Alias = 2,     ///< points outside the drive's own zones
  Bookmark = 3,  ///< a symbolic link that resolves inside the drive
  Symlink = 4,   ///< any other symbolic link
};

/// Everything the framework shows of an item, by value. The meaning of each field is that of the
/// `Item` of protocols/common.capnp, its wire form.
struct ItemFields {
  NSFileProviderItemIdentifier identifier;
  NSFileProviderItemIdentifier parentIdentifier;
  std::string filename;     ///< bytes, as the drive has it
  std::string contentType;  ///< MIME
  ItemKind kind = ItemKind::Document;
  std::uint64_t rawID = 0;
  std::uint64_t size = 0;  ///< bytes
  NSDate creationDate;
  NSDate modificationDate;
  std::optional<NSDate> lastUsedDate;
  std::optional<std::int64_t> favoriteRank;
  std::vector<std::string> tags;
  std::uint32_t capabilities = 0;
  std::uint32_t flags = 0;  ///< `itemFlag…` of protocols/common.capnp
  std::uint64_t rank = 0;
  std::uint64_t version = 0;
  std::uint32_t childCount = 0;
  std::string containerID;

  friend bool operator==(const ItemFields&, const ItemFields&) = default;
};

/// An item as the framework sees it. The client library's item class conforms to it and is handed
/// to the framework unchanged.
///
/// Ownership: shared, immutable.
class NSFileProviderItem : public NSObject {
 public:
  [[nodiscard]] virtual const ItemFields& fields() const = 0;
  [[nodiscard]] const NSFileProviderItemIdentifier& itemIdentifier() const {
    return fields().identifier;
  }
  [[nodiscard]] const std::string& filename() const { return fields().filename; }
};

using NSFileProviderItemRef = std::shared_ptr<const NSFileProviderItem>;
using NSFileProviderItems = std::vector<NSFileProviderItemRef>;

}  // namespace yomber
