#include "zarn/journal_commit.h"

#include <ranges>

#include "zarn/shown_names.h"

namespace yomber {

namespace {

/// Whether it is shown at a place that is not its name in a folder on disk.
bool isPlace(const ItemRow& row) { return row.parent == kNoParent || row.isContainerFolder(); }

}  // namespace

void JournalCommit::addChanges(const std::vector<ItemChange>& changes) {
  for (const auto& change : changes) {
    if (change.row.isFolder()) noteFolder(change);
  }
  // A name that one item gave up may have been taken by another: all places before come first.
  for (const auto& change : changes) addBefore(change);
  // Where an item was for a moment within the commit is a place before.
  std::unordered_set<std::uint64_t> seen;
  for (const auto& change : std::views::reverse(changes)) {
    if (seen.insert(change.row.id).second) addAfter(change.row);
  }
}

void JournalCommit::addTouched(const std::vector<ItemRow>& rows) {
  for (const auto& row : rows) {
    if (isPlace(row)) {
      addItself(row);
    } else {
      addEntry(row.parent, row.nameOnDisk());
    }
  }
}

void JournalCommit::noteFolder(const ItemChange& change) {
  const ItemRow& row = change.row;
  inodes_[row.id] = row.inode;
  if (row.isDead()) {
    // It may still be there, under a name that the drive leaves alone; then nobody watches it.
    dead_.insert(row.id);
    news_.entries.push_back({.folder = row.inode, .name = {}});
    return;
  }
  dead_.erase(row.id);
  if (change.isNew || change.inodeBefore == row.inode) return;
  // Another folder in its place.
  bool hasNames = false;
  const NSErrorRef error = store_.database()->read(
      [&](Connection& connection) { hasNames = hasShownNames(connection, row.id); });
  if (hasNames || error) hasLostTrack_ = true;
}

void JournalCommit::addBefore(const ItemChange& change) {
  if (change.row.isContainerFolder()) addContainer(change);
  if (change.isNew || isPlace(change.row)) return;
  addEntry(change.parentBefore, change.nameOnDiskBefore());
  if (!change.diskNameBefore.empty()) addShownName(change.parentBefore, change.diskNameBefore, {});
}

void JournalCommit::addAfter(const ItemRow& row) {
  if (row.isDead()) return;
  if (isPlace(row)) return addItself(row);
  addEntry(row.parent, row.nameOnDisk());
  if (!row.diskName.empty()) addShownName(row.parent, row.diskName, row.name);
}

void JournalCommit::addContainer(const ItemChange& change) {
  const ItemRow& row = change.row;
  const bool isShownSame = !change.isNew && !row.isDead() && change.nameBefore == row.name &&
                           change.inodeBefore == row.inode;
  if (isShownSame) return;
  news_.shownNames.push_back({.folder = row.inode,
                              .name = {},
                              .shownName = row.isDead() ? std::string() : row.name,
                              .location = store_.layout().documents(row.extra->containerID)});
}

void JournalCommit::addEntry(std::uint64_t folder, const std::string& name) {
  if (dead_.contains(folder) || isWatched(folder)) return;
  if (const std::uint64_t inode = inodeOf(folder); inode != 0) {
    news_.entries.push_back({.folder = inode, .name = name});
  }
}

void JournalCommit::addItself(const ItemRow& row) {
  if (!isWatched(row.id)) news_.entries.push_back({.folder = row.inode, .name = "."});
}

void JournalCommit::addShownName(std::uint64_t folder, const std::string& name,
                                 const std::string& shownName) {
  if (const std::uint64_t inode = inodeOf(folder); inode != 0) {
    news_.shownNames.push_back(
        {.folder = inode, .name = name, .shownName = shownName, .location = {}});
  }
}

bool JournalCommit::isWatched(std::uint64_t folder) {
  const auto [at, isNew] = watched_.try_emplace(folder);
  if (isNew) at->second = isWatched_(folder);
  return at->second;
}

std::uint64_t JournalCommit::inodeOf(std::uint64_t folder) {
  const auto [at, isNew] = inodes_.try_emplace(folder);
  if (isNew) {
    const auto row = store_.itemByID(folder);
    at->second = row ? row->inode : 0;
  }
  return at->second;
}

}  // namespace yomber
