#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/foundation/atomic_cell.h"
#include "platform/foundation/error.h"
#include "zarn/database.h"
#include "zarn/item_row.h"
#include "zarn/tree_layout.h"

namespace yomber {

struct ItemChain;

/// A container that has a folder of its own in the root.
struct ContainerFolder {
  std::string containerID;
  std::string displayName;
};

/// Items by id, by name and by location.
///
/// Reads answer nothing both when there is no such item and when the database fails; the latter
/// also stores an error. Thread-safety: every operation may be called on any thread.
class ItemStore {
 public:
  ItemStore(std::shared_ptr<Database> database, TreeLayout layout);

  [[nodiscard]] std::optional<ItemRow> itemByID(std::uint64_t id,
                                                NSErrorRef* error = nullptr) const;
  [[nodiscard]] std::optional<ItemRow> itemByName(std::uint64_t parent, std::string_view name,
                                                  NSErrorRef* error = nullptr) const;
  /// The item at a location, logical names first, then names on disk. Does not look at the disk.
  [[nodiscard]] std::optional<ItemRow> itemAtPath(std::string_view path,
                                                  NSErrorRef* error = nullptr) const;
  /// The folder of a container, the root for the default one.
  [[nodiscard]] std::optional<ItemRow> itemForContainer(std::string_view containerID,
                                                        NSErrorRef* error = nullptr) const;
  /// Every child, in no particular order. For folders of bounded size; listings page instead.
  [[nodiscard]] std::vector<ItemRow> children(std::uint64_t folder,
                                              NSErrorRef* error = nullptr) const;
  /// The folders above an item, nearest first, up to the root or the trash, which is the last.
  [[nodiscard]] std::vector<std::uint64_t> ancestors(std::uint64_t id,
                                                     NSErrorRef* error = nullptr) const;

  /// Where an item is: with the names that the drive has, and with the names on this disk.
  [[nodiscard]] std::optional<std::string> logicalPath(std::uint64_t id,
                                                       NSErrorRef* error = nullptr) const;
  [[nodiscard]] std::optional<std::string> physicalPath(std::uint64_t id,
                                                        NSErrorRef* error = nullptr) const;

  /// The same of an item whose chain was read already.
  [[nodiscard]] std::string physicalPath(const ItemChain& chain) const;

  struct Located {
    ItemRow row;
    std::string path;
  };
  /// An item that was issued an id, and its logical path.
  [[nodiscard]] std::optional<Located> located(std::uint64_t id, NSErrorRef* error = nullptr) const;

  struct Counts {
    std::uint64_t items = 0;  ///< folders included; neither the root nor the trash
    std::uint64_t folders = 0;
  };
  /// Counts again only when something has changed since.
  [[nodiscard]] Counts counts(NSErrorRef* error = nullptr) const;

  /// Makes the root hold exactly these containers' folders: new ones get a row (and their Documents
  /// folder on disk), those of containers that are gone lose theirs, names are kept unique.
  [[nodiscard]] NSErrorRef setContainers(const std::vector<ContainerFolder>& containers);

  [[nodiscard]] const TreeLayout& layout() const { return layout_; }
  [[nodiscard]] const std::shared_ptr<Database>& database() const { return database_; }

 private:
  /// What was counted, and of which state of which database.
  struct Counted {
    std::uint64_t identity = 0;
    std::uint64_t rank = 0;
    Counts counts;
  };

  std::shared_ptr<Database> database_;
  TreeLayout layout_;
  mutable AtomicCell<std::optional<Counted>> counted_;
};

}  // namespace yomber
