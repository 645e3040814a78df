#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <unordered_map>
#include <unordered_set>
#include <vector>

#include "zarn/bulk_load.h"
#include "zarn/folder_snapshot.h"
#include "zarn/link_resolver.h"
#include "zarn/scanner.h"

namespace yomber {

/// A folder's entries in the order in which they are stored, with their sort keys.
struct SortedSnapshot {
  std::unique_ptr<FolderSnapshot> snapshot;
  std::string keys;
  struct Place {
    std::uint32_t entry = 0;
    std::uint32_t keyLength = 0;
    std::uint64_t keyOffset = 0;
  };
  std::vector<Place> order;

  explicit SortedSnapshot(std::unique_ptr<FolderSnapshot> folder);
  [[nodiscard]] std::string_view keyOf(const Place& place) const {
    return std::string_view(keys).substr(place.keyOffset, place.keyLength);
  }
};

/// Fills an empty database from snapshots: parents before what is below them. Ids come from the
/// files' attributes where those have any, else they are issued.
///
/// Throws SQLite::Exception. For one thread at a time.
class FirstScan {
 public:
  FirstScan(BulkLoad& load, const LinkResolver& links, std::weak_ptr<FolderVisitor> visitor)
      : load_(load), links_(links), visitor_(std::move(visitor)) {}

  /// Adds the row of a place: the root, the trash, or a container's folder (whose row is given).
  /// `visit` is the one that reads it.
  void addPlace(ItemRow row, std::uint64_t visit);
  void addFolder(const SortedSnapshot& sorted);

 private:
  struct Parent {
    std::uint64_t id = 0;
    bool isTrashed = false;
  };
  [[nodiscard]] std::uint64_t idFor(const FolderEntry& entry, const ItemAttributes& attributes);
  void fillRow(const FolderSnapshot& snapshot, const FolderEntry& entry,
               const ItemAttributes& attributes, ItemRow& row) const;
  /// Whether a name, or one that is the same text, belongs to one of the first `end` entries or was
  /// given to another item of the folder.
  [[nodiscard]] bool isTaken(const SortedSnapshot& sorted, std::size_t end,
                             const std::string& name) const;
  /// False when the entry keeps its own name.
  bool chooseOtherName(const SortedSnapshot& sorted, std::size_t index, ItemRow& row);

  BulkLoad& load_;
  const LinkResolver& links_;
  const std::weak_ptr<FolderVisitor> visitor_;
  std::unordered_map<std::uint64_t, Parent> visits_;
  std::unordered_set<std::uint64_t> knownIDs_;  ///< those that files brought along
  std::vector<std::string> reserved_;           ///< in the root
  std::vector<std::string> given_;  ///< in the current folder, beside its entries' own names
};

}  // namespace yomber
