#include "zarn/item_row.h"

#include <sys/stat.h>

#include <charconv>
#include <limits>

#include "platform/glimmet/content_types.h"

namespace yomber {
namespace {

constexpr std::uint32_t kHiddenFlag = 32;
constexpr std::uint32_t kOwnerWrite = 0200;

std::uint64_t mixed(std::uint64_t value) {
  value ^= value >> 33U;
  value *= 0xff51afd7ed558ccdULL;
  value ^= value >> 33U;
  value *= 0xc4ceb9fe1a85ec53ULL;
  return value ^ (value >> 33U);
}

}  // namespace

bool ItemExtra::isEmpty() const {
  return tags.empty() && !favoriteRank && !lastUsed && containerID.empty();
}

char identifierLetter(ItemKind kind) {
  if (kind == ItemKind::Folder) return 'i';
  return kind == ItemKind::Alias ? 'a' : 'd';
}

std::string itemIdentifier(std::uint64_t id, ItemKind kind) {
  if (id == kRootID) return NSFileProviderRootContainerItemIdentifier;
  if (id == kTrashID) return NSFileProviderTrashContainerItemIdentifier;
  return std::string{identifierLetter(kind), ':'} + std::to_string(id);
}

std::optional<std::uint64_t> rawIDFromIdentifier(std::string_view identifier) {
  if (identifier == NSFileProviderRootContainerItemIdentifier) return kRootID;
  if (identifier == NSFileProviderTrashContainerItemIdentifier) return kTrashID;
  if (identifier.size() < 3 || identifier[1] != ':') return std::nullopt;
  if (std::string_view("dia").find(identifier[0]) == std::string_view::npos) return std::nullopt;
  if (identifier[2] == '0') return std::nullopt;
  std::uint64_t id = 0;
  const char* const end = identifier.data() + identifier.size();
  const auto [rest, failure] = std::from_chars(identifier.data() + 2, end, id);
  if (failure != std::errc() || rest != end) return std::nullopt;
  constexpr auto kLargest = static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max());
  if (id < kFirstIssuedID || id > kLargest) return std::nullopt;
  return id;
}

std::uint32_t itemCapabilities(const ItemRow& row) {
  constexpr std::uint32_t kReading = NSFileProviderItemCapabilitiesAllowsReading;
  constexpr std::uint32_t kWriting = NSFileProviderItemCapabilitiesAllowsWriting;
  constexpr std::uint32_t kArranging = NSFileProviderItemCapabilitiesAllowsReparenting |
                                       NSFileProviderItemCapabilitiesAllowsRenaming |
                                       NSFileProviderItemCapabilitiesAllowsTrashing |
                                       NSFileProviderItemCapabilitiesAllowsDeleting;
  if (row.id == kTrashID || (row.flags & row_flag::kOnlyReadable) != 0) return kReading;
  const bool isPlace = row.id == kRootID || row.isContainerFolder();
  // A symbolic link's own mode says nothing; what the target allows is the target's.
  const bool isWritable = S_ISLNK(row.mode) || (row.mode & kOwnerWrite) != 0;
  std::uint32_t result = kReading | (isWritable ? kWriting : 0);
  if (!isPlace) result |= kArranging;
  if (row.isTrashed()) result &= ~std::uint32_t{NSFileProviderItemCapabilitiesAllowsTrashing};
  return result;
}

std::uint32_t itemWireFlags(const ItemRow& row) {
  const std::uint32_t hidden = row.name.starts_with('.') ? kHiddenFlag : 0;
  return (row.flags & row_flag::kWireMask) | hidden;
}

std::uint64_t itemVersion(const ItemRow& row) {
  return mixed(static_cast<std::uint64_t>(row.mtime) ^ mixed(row.size ^ mixed(row.inode)));
}

const std::string& itemContentType(const ItemRow& row) {
  switch (row.kind) {
    case ItemKind::Folder:
      return ContentTypes::kFolder;
    case ItemKind::Symlink:
    case ItemKind::Alias:
    case ItemKind::Bookmark:
      return ContentTypes::kSymlink;
    case ItemKind::Document:
      break;
  }
  return ContentTypes::system().typeForName(row.name);
}

ItemFields itemFields(const ItemRow& row) {
  ItemFields fields;
  fields.identifier = itemIdentifier(row.id, row.kind);
  fields.parentIdentifier =
      itemIdentifier(row.parent == kNoParent ? kRootID : row.parent, ItemKind::Folder);
  fields.filename = row.name;
  fields.contentType = itemContentType(row);
  fields.kind = row.kind;
  fields.rawID = row.id;
  fields.size = row.size;
  fields.creationDate = NSDate::fromNanoseconds(row.btime);
  fields.modificationDate = NSDate::fromNanoseconds(row.mtime);
  fields.capabilities = itemCapabilities(row);
  fields.flags = itemWireFlags(row);
  fields.rank = row.rank;
  fields.version = itemVersion(row);
  if (row.extra) {
    if (row.extra->lastUsed) fields.lastUsedDate = NSDate::fromNanoseconds(*row.extra->lastUsed);
    fields.favoriteRank = row.extra->favoriteRank;
    fields.tags = row.extra->tags;
    fields.containerID = row.extra->containerID;
  }
  return fields;
}

}  // namespace yomber
