// Reconciler: which row an entry without one gets, and which rows go.
#include <algorithm>

#include "platform/foundation/fault_points.h"
#include "zarn/chain_path.h"
#include "zarn/reconciler.h"
#include "zarn/row_queries.h"
#include "zarn/tree_walker.h"

namespace yomber {

std::optional<ItemRow> Reconciler::findOwnRow(WriteTransaction& transaction,
                                              const Candidate& candidate) {
  const auto rows = findByInode(transaction.connection(), candidate.entry.inode);
  const auto isOwn = [&](const ItemRow& row) {
    return !row.isContainerFolder() && row.id >= kFirstIssuedID &&
           isSameFile(row, candidate.entry, candidate.attributes);
  };
  const auto isOwnAndGone = [&](const ItemRow& row) {
    return isOwn(row) && gone_.contains(row.id);
  };
  // Of several rows (a file with several names), one whose name is gone has moved.
  auto row = std::find_if(rows.begin(), rows.end(), isOwnAndGone);
  const bool hasOneName = candidate.entry.type != EntryType::File || candidate.entry.links == 1;
  if (row == rows.end() && hasOneName) row = std::find_if(rows.begin(), rows.end(), isOwn);
  if (row == rows.end()) return std::nullopt;
  return *row;
}

bool Reconciler::isElsewhere(const ItemRow& row) const {
  return openInodes_.contains(row.inode) &&
         std::any_of(open_.begin(), open_.end(), [&](const Candidate& candidate) {
           return isSameFile(row, candidate.entry, candidate.attributes);
         });
}

/// A folder is read some time before its entries are decided on. What has gone meanwhile, and whose
/// going others may have seen already, must not come back.
bool Reconciler::isStillThere(const Candidate& candidate) {
  FolderEntry now;
  const bool isThere = lookAtEntry(candidate.folder->get(), candidate.name.c_str(), now) &&
                       now.inode == candidate.entry.inode;
  if (!isThere) noteConflict(candidate.parent, candidate.name);
  return isThere;
}

/// Whether a file is what a program has just written next to a document in order to save it. One
/// that the store has already counts as well while it is young: uploads are faster than some
/// programs. The rename was its last change, so its age then can still be told.
bool Reconciler::isBeingSaved(const Candidate& candidate, const ItemRow& own) {
  constexpr std::int64_t kLongestSave = 60'000'000'000;
  const bool isYoung = candidate.entry.ctime - candidate.entry.btime < kLongestSave;
  const bool isUploaded = (own.flags & row_flag::kUploaded) != 0;
  return !isUploaded || (isYoung && own.parent == candidate.parent);
}

bool Reconciler::takeReplaced(WriteTransaction& transaction, Candidate& candidate) {
  const auto place = gone_.find(candidate.replaced);
  if (place == gone_.end() || candidate.entry.type != EntryType::File) return false;
  ItemRow replaced = place->second;
  if (!isSameType(replaced, candidate.entry) || isElsewhere(replaced)) return false;
  if (!isStillThere(candidate)) return false;
  const auto current = findByID(transaction.connection(), replaced.id);
  if (!current) return false;
  if (current->rank != replaced.rank || current->inode != replaced.inode) {
    // Another scan was faster: perhaps the file is the document already.
    gone_.erase(place);
    noteConflict(candidate.parent, candidate.name);
    return true;
  }
  const auto own = findOwnRow(transaction, candidate);
  if (own && !isBeingSaved(candidate, *own)) return false;
  // A file that nobody else knows yet, saved over a document: the document goes on.
  if (own) {
    gone_.erase(own->id);
    transaction.remove(*own);
  }
  gone_.erase(replaced.id);
  candidate.attributes.id.reset();
  // Its tags too, where the program that saved it did not copy them.
  if (candidate.attributes.extra.isEmpty()) replaced.flags |= row_flag::kKeepsExtra;
  (void)storeChanged(transaction, candidate, replaced);  // a file
  return true;
}

/// The new file of a document whose old one has just become a backup.
bool Reconciler::takeBackedUp(WriteTransaction& transaction, Candidate& candidate,
                              const std::optional<ItemRow>& own) {
  if (candidate.entry.type != EntryType::File) return false;
  if (own && !isBeingSaved(candidate, *own)) return false;
  const auto backup = transaction.recentBackups().take(candidate.parent, candidate.name);
  if (!backup || (own && own->id == backup->document.id)) return false;
  const auto row = findByID(transaction.connection(), backup->document.id);
  const bool isBackup = row && row->parent == candidate.parent &&
                        row->nameOnDisk() == backup->backupName &&
                        isSameType(*row, candidate.entry);
  if (row && !isBackup) return false;
  if (own) {
    gone_.erase(own->id);
    transaction.remove(*own);
  }
  if (!row) {
    // The backup was seen to go before the new file was seen.
    candidate.attributes.id.reset();
    add(transaction, candidate, backup->document);
    return true;
  }
  gone_.erase(row->id);
  candidate.attributes.id.reset();
  (void)storeChanged(transaction, candidate, *row);
  // What is there now, if it is still there, is a file of its own.
  noteConflict(candidate.parent, backup->backupName);
  return true;
}

void Reconciler::decide(WriteTransaction& transaction, Candidate& candidate) {
  if (!isStillThere(candidate)) {
    // What it replaced is decided on with whatever is there now.
    gone_.erase(candidate.replaced);
    return;
  }
  const auto own = findOwnRow(transaction, candidate);
  if (takeBackedUp(transaction, candidate, own)) return;
  if (own) {
    if (isNewer(own->rank, candidate.rankBefore)) {
      noteConflict(candidate.parent, candidate.name);
    } else {
      move(transaction, candidate, *own);
    }
    return;
  }
  const auto& id = candidate.attributes.id;
  // A twin that a copy has brought: the file that is known keeps the id.
  if (id && (!candidate.entry.carriesID() || findByID(transaction.connection(), *id))) {
    candidate.attributes.id.reset();
  }
  add(transaction, candidate);
}

void Reconciler::move(WriteTransaction& transaction, const Candidate& candidate,
                      const ItemRow& row) {
  static FaultPoint seen("zarn.move.seen");
  static FaultPoint stored("zarn.move.stored");
  (void)seen.hit();
  gone_.erase(row.id);
  if (!storeChanged(transaction, candidate, row)) return postpone(candidate);
  (void)stored.hit();
  const std::string& name = row.nameOnDisk();
  const bool isBackup = row.kind == ItemKind::Document && row.parent == candidate.parent &&
                        isBackupName(candidate.name, name);
  if (isBackup) transaction.recentBackups().note(row, candidate.name);
  if (candidate.entry.type == EntryType::Folder && candidate.snapshot != nullptr) {
    noteFolder(*candidate.snapshot, candidate.entry, row.id, false);
  }
}

/// A folder has moved into one that still has its row below it: that one has moved as well, which
/// is seen when everything was compared.
void Reconciler::postpone(const Candidate& candidate) {
  if (candidate.snapshot == nullptr) return noteConflict(candidate.parent, candidate.name);
  open_.push_back(candidate);
  open_.back().snapshot = nullptr;
  ++openFolders_;
}

/// What it was before it was seen to go, without being seen to come.
std::optional<ItemRow> Reconciler::findFormer(WriteTransaction& transaction,
                                              const Candidate& candidate) {
  // Without a birth time another file with its inode could be taken for it.
  if (candidate.attributes.id || !candidate.entry.hasBirthTime) return std::nullopt;
  return transaction.recentlyGone().take(candidate.entry.inode, [&](const ItemRow& row) {
    return isSameFile(row, candidate.entry, candidate.attributes) &&
           !findByID(transaction.connection(), row.id);
  });
}

void Reconciler::add(WriteTransaction& transaction, const Candidate& candidate,
                     std::optional<ItemRow> former) {
  // Somebody else's scan may have been faster.
  const auto present = findByDiskName(transaction.connection(), candidate.parent, candidate.name);
  if (present && !gone_.contains(present->id)) return;
  ItemRow row;
  if (!former) former = findFormer(transaction, candidate);
  if (former) {
    row.extra = former->extra;
    row.flags = former->flags & row_flag::kKeepsExtra;
  }
  describe(candidate, row);
  row.id = candidate.attributes.id ? *candidate.attributes.id
                                   : (former ? former->id : transaction.issueID());
  row.parent = candidate.parent;
  choosePlace(transaction, candidate, row);
  stamp(candidate, row);
  transaction.insert(row);
  if (candidate.entry.type == EntryType::Folder && candidate.snapshot != nullptr) {
    noteFolder(*candidate.snapshot, candidate.entry, row.id, true);
  }
}

void Reconciler::decideOpen(WriteTransaction& transaction) {
  for (const Candidate& candidate : open_) openInodes_.insert(candidate.entry.inode);
  // First those that took a vanished file's place: what they leave open are moves and newcomers.
  std::vector<Candidate> rest;
  std::vector<bool> isDone(open_.size());
  for (std::size_t i = 0; i < open_.size(); ++i) {
    isDone[i] = open_[i].replaced != 0 && takeReplaced(transaction, open_[i]);
  }
  for (std::size_t i = 0; i < open_.size(); ++i) {
    if (!isDone[i]) rest.push_back(std::move(open_[i]));
  }
  open_.clear();
  openFolders_ = 0;
  openInodes_.clear();
  for (Candidate& candidate : rest) decide(transaction, candidate);
}

void Reconciler::finish(WriteTransaction& transaction) {
  const OwnRanks ownRanks(*this, transaction);
  decideOpen(transaction);
  removeGone(transaction);
}

/// What was away when its folder was read can have come back since, without a change that others
/// would have seen: then its row must not go.
bool Reconciler::isBack(Connection& connection, const ItemRow& row, FormerFolder& former) const {
  // Its name is another item's by now.
  const auto named = findByName(connection, row.parent, row.name);
  if (!named || named->id != row.id) return false;
  if (former.id != row.parent) {
    former = {.id = row.parent, .folder = nullptr};
    const auto chain = findChain(connection, row.parent);
    const auto place =
        chain ? links_.layout().placeOf(pathOfChain(links_.layout(), *chain, Names::OnDisk))
              : std::nullopt;
    const auto base = place ? openFolder(place->path) : nullptr;
    if (base) former.folder = openFolderBelow(base->get(), place->relative);
  }
  FolderEntry entry;
  const std::string& name = row.nameOnDisk();
  if (!former.folder || !lookAtEntry(former.folder->get(), name.c_str(), entry)) return false;
  ItemAttributes attributes;
  if (!entry.hasBirthTime && entry.type != EntryType::Symlink)
    attributes = readItemAttributes(pathThroughDescriptor(former.folder->get(), name).c_str());
  return isSameFile(row, entry, attributes);
}

void Reconciler::removeGone(WriteTransaction& transaction) {
  FormerFolder former;
  for (const auto& [id, row] : gone_) {
    const auto current = findByID(transaction.connection(), id);
    if (!current) continue;  // its folder has taken it along
    if (current->rank == row.rank && !isBack(transaction.connection(), *current, former)) {
      transaction.remove(*current);
    } else {
      noteConflict(current->parent, current->nameOnDisk());
    }
  }
  gone_.clear();
}

}  // namespace yomber
