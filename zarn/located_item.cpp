#include "zarn/located_item.h"

#include <cerrno>

#include "zarn/daemon_errors.h"
#include "zarn/folder_opener.h"
#include "zarn/folder_snapshot.h"

namespace yomber {
namespace {

constexpr int kMaximumAttempts = 4;

bool isPlace(const ItemRow& row) { return row.parent == kNoParent || row.isContainerFolder(); }

/// Whether the item is there still.
bool open(const ItemStore& store, LocatedItem& item) {
  FolderOpener folders(store);
  item.name = isPlace(item.row) ? "." : item.row.nameOnDisk();
  item.folder = folders.open(isPlace(item.row) ? item.row.id : item.row.parent);
  FolderEntry entry;
  return item.folder && lookAtEntry(item.folder->get(), item.name.c_str(), entry) &&
         entry.inode == item.row.inode;
}

}  // namespace

std::optional<ItemRow> findItemOnDisk(const ItemStore& store, Scanner& scanner,
                                      std::string_view path, NSErrorRef* error) {
  const TreeLayout& layout = store.layout();
  if (layout.isPrivate(path)) {
    storeError(error, refusedError(EPERM, path,
                                   "this is the drive's own storage; nothing in it is an item"));
    return std::nullopt;
  }
  if (!layout.placeOf(path)) {
    storeError(error, outsideTreeError(path));
    return std::nullopt;
  }
  return scanner.scanLocation(path, error);
}

std::optional<LocatedItem> locateItem(const ItemStore& store, Scanner& scanner,
                                      std::string_view path, NSErrorRef* error) {
  // An item may move between the look at it and its folder's opening.
  for (int attempt = 0; attempt < kMaximumAttempts; ++attempt) {
    auto row = findItemOnDisk(store, scanner, path, error);
    if (!row) return std::nullopt;
    LocatedItem item{.row = std::move(*row), .folder = {}, .name = {}};
    if (open(store, item)) return item;
  }
  storeError(error, noSuchLocationError(std::string(path)));
  return std::nullopt;
}

}  // namespace yomber
