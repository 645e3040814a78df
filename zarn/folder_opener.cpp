#include "zarn/folder_opener.h"

#include <algorithm>
#include <vector>

#include "zarn/tree_walker.h"

namespace yomber {
namespace {

constexpr std::size_t kKeptFolders = 32;

}  // namespace

std::shared_ptr<const FileDescriptor> FolderOpener::find(std::uint64_t folder) {
  const auto entry = std::find_if(opened_.begin(), opened_.end(),
                                  [&](const Opened& opened) { return opened.id == folder; });
  if (entry == opened_.end()) return nullptr;
  opened_.splice(opened_.begin(), opened_, entry);
  return opened_.front().folder;
}

void FolderOpener::keep(std::uint64_t folder, std::shared_ptr<const FileDescriptor> opened) {
  opened_.push_front({folder, std::move(opened)});
  if (opened_.size() > kKeptFolders) opened_.pop_back();
}

std::shared_ptr<const FileDescriptor> FolderOpener::openPlace(const ItemRow& row) const {
  const TreeLayout& layout = store_.layout();
  if (row.isContainerFolder()) return openFolder(layout.documents(row.extra->containerID));
  return openFolder(row.id == kTrashID ? layout.trashFiles() : layout.root());
}

std::shared_ptr<const FileDescriptor> FolderOpener::open(std::uint64_t folder) {
  std::vector<ItemRow> way;
  std::shared_ptr<const FileDescriptor> at = find(folder);
  while (!at) {
    auto row = store_.itemByID(folder);
    if (!row) return nullptr;
    if (row->parent == kNoParent || row->isContainerFolder()) {
      at = openPlace(*row);
      if (!at) return nullptr;
      keep(row->id, at);
      break;
    }
    folder = row->parent;
    way.push_back(std::move(*row));
    at = find(folder);
  }
  for (auto row = way.rbegin(); row != way.rend(); ++row) {
    at = openFolderBelow(at->get(), row->nameOnDisk());
    if (!at) return nullptr;
    keep(row->id, at);
  }
  return at;
}

}  // namespace yomber
