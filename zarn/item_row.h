#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/fileprovider/item.h"

namespace yomber {

/// Raw ids that stand for places rather than for items that were issued one.
inline constexpr std::uint64_t kRootID = 0;                    ///< the root folder
inline constexpr std::uint64_t kTrashID = 1;                   ///< the trash's files folder
inline constexpr std::uint64_t kNoParent = ~std::uint64_t{0};  ///< parent of those two
/// Smaller raw ids are never issued to items.
inline constexpr std::uint64_t kFirstIssuedID = 1024;

/// Bits of `ItemRow::flags`. The lower ones are `itemFlag…` of protocols/common.capnp; those from
/// bit 16 up are the engine's own and never leave it.
namespace row_flag {
inline constexpr std::uint32_t kDead = 1;
inline constexpr std::uint32_t kTrashed = 2;
inline constexpr std::uint32_t kDownloaded = 4;
inline constexpr std::uint32_t kUploaded = 8;
inline constexpr std::uint32_t kShared = 16;
inline constexpr std::uint32_t kWireMask = 0xffff;
inline constexpr std::uint32_t kStamped = 1U << 16U;   ///< the file carries its id as an attribute
inline constexpr std::uint32_t kHasExtra = 1U << 17U;  ///< there is an ItemExtra
/// The row alone holds what else is known: the file cannot carry it (a symbolic link, several hard
/// links). Whatever attributes the file has do not count.
inline constexpr std::uint32_t kKeepsExtra = 1U << 18U;
/// It lies in what somebody shares with this account for reading only.
inline constexpr std::uint32_t kOnlyReadable = 1U << 19U;
}  // namespace row_flag

/// What few items have: kept apart so that rows stay slim.
struct ItemExtra {
  std::vector<std::string> tags;
  std::optional<std::int64_t> favoriteRank;
  std::optional<std::int64_t> lastUsed;  ///< ns since the epoch
  std::string containerID;               ///< of a container's own folder

  [[nodiscard]] bool isEmpty() const;
  friend bool operator==(const ItemExtra&, const ItemExtra&) = default;
};

/// One item as the database knows it. A value; `extra` is shared and immutable, null for most.
struct ItemRow {
  std::uint64_t id = 0;
  std::uint64_t parent = kNoParent;
  std::string name;      ///< bytes, as the drive has it
  std::string diskName;  ///< the name on this disk where it differs from `name`, else empty
  ItemKind kind = ItemKind::Document;
  std::uint32_t flags = 0;
  std::uint32_t mode = 0;  ///< st_mode
  std::uint64_t size = 0;  ///< bytes; 0 for folders
  std::int64_t mtime = 0;  ///< ns since the epoch
  std::int64_t btime =
      0;  ///< ns; the creation date (the modification date where the disk has none)
  std::int64_t ctime = 0;  ///< ns; not filled in by listings
  std::uint64_t inode = 0;
  std::uint64_t rank = 0;  ///< of the last change
  std::shared_ptr<const ItemExtra> extra;

  [[nodiscard]] bool isFolder() const { return kind == ItemKind::Folder; }
  [[nodiscard]] bool isDead() const { return (flags & row_flag::kDead) != 0; }
  [[nodiscard]] bool isTrashed() const { return (flags & row_flag::kTrashed) != 0; }
  /// Whether this is the folder of a container (it cannot be renamed, moved or trashed).
  [[nodiscard]] bool isContainerFolder() const { return extra && !extra->containerID.empty(); }
  [[nodiscard]] const std::string& nameOnDisk() const { return diskName.empty() ? name : diskName; }
};

/// The letter that an identifier begins with: 'i' folders, 'a' aliases, 'd' everything else.
[[nodiscard]] char identifierLetter(ItemKind kind);
/// "d:123", or the framework's constants for the root and the trash.
[[nodiscard]] std::string itemIdentifier(std::uint64_t id, ItemKind kind);
/// The raw id in an identifier; nothing when it is malformed. Does not look whether the item
/// exists.
[[nodiscard]] std::optional<std::uint64_t> rawIDFromIdentifier(std::string_view identifier);

/// NSFileProviderItemCapabilities bits.
[[nodiscard]] std::uint32_t itemCapabilities(const ItemRow& row);
/// `itemFlag…` bits for the wire, with "hidden" worked out from the name.
[[nodiscard]] std::uint32_t itemWireFlags(const ItemRow& row);
/// A value that changes whenever the content does.
[[nodiscard]] std::uint64_t itemVersion(const ItemRow& row);
/// The MIME type, by name.
[[nodiscard]] const std::string& itemContentType(const ItemRow& row);
/// Everything at once. `parentIsFolder` is implied: only folders have children.
[[nodiscard]] ItemFields itemFields(const ItemRow& row);

/// One committed change of a row.
struct ItemChange {
  ItemRow row;  ///< after; with kDead set: as it was last, with the rank of its deletion
  bool isNew = false;
  std::uint64_t parentBefore = kNoParent;  ///< kNoParent when new
  std::string nameBefore;                  ///< empty when new
  std::string diskNameBefore;              ///< as in `ItemRow`; empty when new
  std::uint64_t inodeBefore = 0;           ///< 0 when new

  [[nodiscard]] bool isDead() const { return row.isDead(); }
  [[nodiscard]] bool hasMoved() const { return !isNew && parentBefore != row.parent; }
  [[nodiscard]] const std::string& nameOnDiskBefore() const {
    return diskNameBefore.empty() ? nameBefore : diskNameBefore;
  }
};

}  // namespace yomber
