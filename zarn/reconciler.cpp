#include "zarn/reconciler.h"

#include <algorithm>

#include "zarn/entry_table.h"
#include "zarn/row_queries.h"

namespace yomber {
namespace {

/// How many folders the entries that wait for a decision may keep open.
constexpr std::size_t kMaximumOpenFolders = 64;

constexpr const char* kCompared =
    "SELECT id,inode,ctime,rank,size,coalesce(disk_name,name) FROM item WHERE parent=?1";

// Containers' folders lie elsewhere and have no entries in the root.
constexpr const char* kComparedInRoot =
    "SELECT id,inode,ctime,rank,size,coalesce(disk_name,name) FROM item WHERE parent=?1 "
    "AND id NOT IN (SELECT id FROM extra WHERE container_id IS NOT NULL)";

std::string attributePath(const FolderSnapshot& snapshot, const FolderEntry& entry) {
  return pathThroughDescriptor(snapshot.folder->get(), snapshot.nameOf(entry));
}

}  // namespace

bool isSameType(const ItemRow& row, const FolderEntry& entry) {
  switch (entry.type) {
    case EntryType::Folder:
      return row.isFolder();
    case EntryType::Symlink:
      return row.kind == ItemKind::Bookmark || row.kind == ItemKind::Symlink;
    case EntryType::File:
      return row.kind == ItemKind::Document || row.kind == ItemKind::Alias;
  }
  return false;
}

bool isAsBefore(const ItemRow& row, const FolderEntry& entry) {
  // The size as well: while a file is written, its dates change a moment before its size does.
  return row.inode == entry.inode && row.ctime == entry.ctime && row.size == entry.size;
}

bool isSameFile(const ItemRow& row, const FolderEntry& entry, const ItemAttributes& attributes) {
  if (!isSameType(row, entry) || row.inode != entry.inode) return false;
  if (entry.hasBirthTime) return row.btime == entry.btime;
  if (attributes.id) return *attributes.id == row.id;
  return (row.flags & row_flag::kStamped) == 0;
}

bool Reconciler::isNewer(std::uint64_t rank, std::uint64_t rankBefore) const {
  if (rank <= rankBefore) return false;
  const auto own =
      std::lower_bound(ownRanks_.begin(), ownRanks_.end(), rank,
                       [](const auto& range, std::uint64_t r) { return range.second < r; });
  return own == ownRanks_.end() || rank <= own->first;
}

void Reconciler::noteConflict(std::uint64_t folder, std::string_view name) {
  auto& names = conflicts_[folder];
  if (!name.empty()) names.emplace(name);
}

std::vector<DirtyFolder> Reconciler::takeConflicts() {
  std::vector<DirtyFolder> result;
  for (const auto& [folder, names] : std::exchange(conflicts_, {})) {
    DirtyFolder dirty;
    dirty.id = folder;
    dirty.names.assign(names.begin(), names.end());
    result.push_back(std::move(dirty));
  }
  return result;
}

Reconciler::Differences Reconciler::findDifferences(WriteTransaction& transaction,
                                                    std::uint64_t folder,
                                                    const FolderSnapshot& snapshot) {
  const EntryTable table(snapshot);
  Differences result;
  result.isKnown.resize(snapshot.entries.size());
  StatementUse rows(
      transaction.connection().prepared(folder == kRootID ? kComparedInRoot : kCompared));
  rows->bindID(1, folder);
  while (rows->step()) {
    const std::uint64_t id = rows->id(0);
    const bool isLeftAlone = isNewer(rows->id(3), snapshot.rankBefore);
    const auto index = table.find(rows->bytes(5));
    if (!index || result.isKnown[*index]) {
      if (isLeftAlone) {
        noteConflict(folder, rows->bytes(5));
      } else if (!snapshot.isPartial) {
        result.gone.push_back(id);
      }
      continue;
    }
    result.isKnown[*index] = true;
    const FolderEntry& entry = snapshot.entries[*index];
    const bool isUnchanged =
        rows->id(1) == entry.inode && rows->integer(2) == entry.ctime && rows->id(4) == entry.size;
    if (isLeftAlone && !isUnchanged) noteConflict(folder, rows->bytes(5));
    if (isUnchanged || isLeftAlone) {
      if (entry.type == EntryType::Folder) noteFolder(snapshot, entry, id, false);
    } else {
      result.differing.push_back({id, *index});
    }
  }
  return result;
}

void Reconciler::compareFolder(WriteTransaction& transaction, const FolderSnapshot& snapshot) {
  const OwnRanks ownRanks(*this, transaction);
  const auto visit = visits_.find(snapshot.visit);
  if (visit == visits_.end()) return;
  const std::uint64_t folder = visit->second;
  visits_.erase(visit);
  const auto visitor = visitor_.lock();
  const bool isRead = snapshot.isReadable && refreshFolder(transaction, folder, snapshot);
  turns_[folder] = isRead;
  if (!isRead) {
    if (visitor) visitor->didNotReadFolder(folder);
    return;
  }
  if (visitor) visitor->didIdentifyFolder(snapshot.visit, folder);

  const Differences differences = findDifferences(transaction, folder, snapshot);
  for (const std::uint64_t id : differences.gone) {
    if (auto row = findByID(transaction.connection(), id)) noteGone(std::move(*row), snapshot);
  }
  for (const Differing& differing : differences.differing) {
    const FolderEntry& entry = snapshot.entries[differing.entry];
    auto row = findByID(transaction.connection(), differing.id);
    // It may have moved on to another name of this very folder just now.
    const bool isStillHere =
        row && row->parent == folder && row->nameOnDisk() == snapshot.nameOf(entry);
    if (isStillHere) {
      settleKnown(transaction, snapshot, std::move(*row), entry);
    } else {
      addCandidate(transaction, folder, snapshot, entry, 0);
    }
  }
  for (std::size_t i = 0; i < snapshot.entries.size(); ++i) {
    if (differences.isKnown[i]) continue;
    addCandidate(transaction, folder, snapshot, snapshot.entries[i], 0);
  }
  // With what is known so far, rather than without descriptors.
  if (openFolders_ > kMaximumOpenFolders) decideOpen(transaction);
}

void Reconciler::compareName(WriteTransaction& transaction, std::uint64_t folder,
                             const std::string& name, const FolderSnapshot& snapshot) {
  const OwnRanks ownRanks(*this, transaction);
  compareEntry(transaction, folder, name, snapshot,
               snapshot.entries.empty() ? nullptr : &snapshot.entries.front(), Trust::Times);
}

void Reconciler::compareNames(WriteTransaction& transaction, std::uint64_t folder,
                              const std::vector<std::string>& names,
                              const FolderSnapshot& snapshot) {
  const OwnRanks ownRanks(*this, transaction);
  if (!refreshFolder(transaction, folder, snapshot)) return;
  const EntryTable table(snapshot);
  for (const std::string& name : names) {
    const auto index = table.find(name);
    compareEntry(transaction, folder, name, snapshot, index ? &snapshot.entries[*index] : nullptr,
                 Trust::Nothing);
  }
}

/// `entry` is null when nothing has that name.
void Reconciler::compareEntry(WriteTransaction& transaction, std::uint64_t folder,
                              const std::string& name, const FolderSnapshot& snapshot,
                              const FolderEntry* entry, Trust trust) {
  auto row = findByDiskName(transaction.connection(), folder, name);
  if (entry == nullptr) {
    if (row) noteGone(std::move(*row), snapshot);
  } else if (!row) {
    addCandidate(transaction, folder, snapshot, *entry, 0);
  } else if (trust == Trust::Nothing || !isAsBefore(*row, *entry)) {
    settleKnown(transaction, snapshot, std::move(*row), *entry);
  }
}

bool Reconciler::refreshFolder(WriteTransaction& transaction, std::uint64_t folder,
                               const FolderSnapshot& snapshot) {
  const auto row = findByID(transaction.connection(), folder);
  if (!row || !row->isFolder()) return false;
  const FolderEntry& self = snapshot.self;
  if (isAsBefore(*row, self)) return true;
  Candidate candidate;
  candidate.parent = row->parent;
  candidate.name = row->nameOnDisk();
  candidate.entry = self;
  candidate.folder = snapshot.folder;
  candidate.isOpenedFolder = true;
  candidate.attributes =
      readItemAttributes(pathThroughDescriptor(snapshot.folder->get(), ".").c_str());
  const bool isPlace = folder == kRootID || folder == kTrashID || row->isContainerFolder();
  // Another folder has come to this place since its entry was compared: its own turn will come.
  if (!isPlace && !isSameFile(*row, self, candidate.attributes)) return false;
  if (isNewer(row->rank, snapshot.rankBefore)) {
    noteConflict(folder, {});
  } else {
    (void)storeChanged(transaction, candidate, *row);  // in its place
  }
  return true;
}

void Reconciler::settleKnown(WriteTransaction& transaction, const FolderSnapshot& snapshot,
                             ItemRow row, const FolderEntry& entry) {
  if (isNewer(row.rank, snapshot.rankBefore)) {
    noteConflict(row.parent, row.nameOnDisk());
    return;
  }
  ItemAttributes attributes;
  if (entry.type != EntryType::Symlink) {
    attributes = readItemAttributes(attributePath(snapshot, entry).c_str());
  }
  // What carries no id of its own is known by its place; so is a copy that was put in the place of
  // its original.
  const bool isByPlace = isSameType(row, entry) && (!entry.carriesID() || attributes.id == row.id);
  if (!isByPlace && !isSameFile(row, entry, attributes)) {
    const std::uint64_t parent = row.parent;
    const std::uint64_t replaced = row.id;
    noteGone(std::move(row), snapshot);
    addCandidate(transaction, parent, snapshot, entry, replaced);
    return;
  }
  Candidate candidate{.snapshot = &snapshot,
                      .parent = row.parent,
                      .name = row.nameOnDisk(),
                      .entry = entry,
                      .attributes = std::move(attributes),
                      .folder = snapshot.folder,
                      .rankBefore = snapshot.rankBefore};
  const bool isOtherFolder = row.isFolder() && row.inode != entry.inode;
  (void)storeChanged(transaction, candidate, row);  // in its place
  if (entry.type == EntryType::Folder) noteFolder(snapshot, entry, row.id, isOtherFolder);
}

void Reconciler::noteGone(ItemRow row, const FolderSnapshot& snapshot) {
  // A container's folder lies elsewhere and has no entry in the root.
  if (row.isContainerFolder()) return;
  if (isNewer(row.rank, snapshot.rankBefore)) {
    noteConflict(row.parent, row.nameOnDisk());
    return;
  }
  const std::uint64_t id = row.id;
  gone_.insert_or_assign(id, std::move(row));
}

void Reconciler::addCandidate(WriteTransaction& transaction, std::uint64_t folder,
                              const FolderSnapshot& snapshot, const FolderEntry& entry,
                              std::uint64_t replaced) {
  Candidate candidate{.snapshot = &snapshot,
                      .parent = folder,
                      .name = std::string(snapshot.nameOf(entry)),
                      .entry = entry,
                      .attributes = {},
                      .folder = snapshot.folder,
                      .rankBefore = snapshot.rankBefore,
                      .replaced = replaced};
  if (entry.type != EntryType::Symlink) {
    candidate.attributes = readItemAttributes(attributePath(snapshot, entry).c_str());
  }
  // Whether a file took the place of another that is gone, or a name is one more of a file that has
  // several, is only known when everything was compared. Such are few.
  const bool isOpen = (replaced != 0 && entry.type != EntryType::Folder) ||
                      (entry.type == EntryType::File && entry.links > 1);
  if (!isOpen) {
    decide(transaction, candidate);
    return;
  }
  candidate.snapshot = nullptr;  // gone by the time it is decided
  if (open_.empty() || open_.back().folder != candidate.folder) ++openFolders_;
  open_.push_back(std::move(candidate));
}

void Reconciler::noteFolder(const FolderSnapshot& snapshot, const FolderEntry& entry,
                            std::uint64_t id, bool isNew) {
  if (comparesEverything_) {
    visits_[entry.visit] = id;
  } else if (isNew) {
    visits_[entry.visit] = id;
    newFolders_.push_back({snapshot.folder, std::string(snapshot.nameOf(entry)), entry.visit});
  }
}

}  // namespace yomber
