// Reconciler: rows from entries.
#include "platform/foundation/bounced_name.h"
#include "platform/foundation/fault_points.h"
#include "zarn/change_times.h"
#include "zarn/reconciler.h"
#include "zarn/row_queries.h"

namespace yomber {
namespace {

constexpr std::uint32_t kFromDisk = row_flag::kShared | row_flag::kOnlyReadable |
                                    row_flag::kDownloaded | row_flag::kHasExtra |
                                    row_flag::kStamped;

bool isShownDifferently(const ItemRow& left, const ItemRow& right) {
  constexpr std::uint32_t kUnseen =
      row_flag::kStamped | row_flag::kHasExtra | row_flag::kKeepsExtra;
  const bool hasSameExtra =
      left.extra == right.extra || (left.extra && right.extra && *left.extra == *right.extra);
  return left.parent != right.parent || left.name != right.name ||
         left.diskName != right.diskName || left.kind != right.kind ||
         (left.flags & ~kUnseen) != (right.flags & ~kUnseen) || left.mode != right.mode ||
         left.size != right.size || left.mtime != right.mtime || left.btime != right.btime ||
         (left.isFolder() && left.inode != right.inode) || !hasSameExtra;
}

/// Its content is being filled in or given up: what is stored of it stays.
void keepContent(const ItemRow& before, ItemRow& after) {
  after.size = before.size;
  after.mtime = before.mtime;
  after.ctime = before.ctime;
  after.flags = (after.flags & ~row_flag::kDownloaded) | (before.flags & row_flag::kDownloaded);
}

bool isSameContent(const ItemRow& left, const ItemRow& right) {
  return left.inode == right.inode && left.size == right.size && left.mtime == right.mtime;
}

}  // namespace

void Reconciler::describe(const Candidate& candidate, ItemRow& row) const {
  const FolderEntry& entry = candidate.entry;
  switch (entry.type) {
    case EntryType::File:
      row.kind = ItemKind::Document;
      break;
    case EntryType::Folder:
      row.kind = ItemKind::Folder;
      break;
    case EntryType::Symlink:
      row.kind = links_.isBookmark(candidate.folder->get(), candidate.name) ? ItemKind::Bookmark
                                                                            : ItemKind::Symlink;
      break;
  }
  row.mode = entry.mode;
  row.size = entry.size;
  row.mtime = entry.mtime;
  row.btime = entry.btime;
  row.ctime = entry.changeTimeToRemember();
  row.inode = entry.inode;

  const ItemAttributes& attributes = candidate.attributes;
  const bool isKept = (row.flags & row_flag::kKeepsExtra) != 0;
  ItemExtra extra = isKept ? ItemExtra{} : attributes.extra;
  if (isKept && row.extra) extra = *row.extra;
  if (row.extra) extra.containerID = row.extra->containerID;
  row.extra = extra.isEmpty() ? nullptr : std::make_shared<const ItemExtra>(std::move(extra));
  row.flags &= ~kFromDisk;
  if (attributes.isShared) row.flags |= row_flag::kShared;
  if (attributes.isOnlyReadable) row.flags |= row_flag::kOnlyReadable;
  if (!attributes.isFault) row.flags |= row_flag::kDownloaded;
  if (row.extra) row.flags |= row_flag::kHasExtra;
}

void Reconciler::choosePlace(WriteTransaction& transaction, const Candidate& candidate,
                             ItemRow& row) {
  row.parent = candidate.parent;
  const auto isGone = [&](const ItemRow& other) { return gone_.contains(other.id); };
  row.name = bouncedName(candidate.name, [&](const std::string& name) {
    return transaction.isNameTaken(row.parent, name, row.id, isGone);
  });
  row.diskName = row.name == candidate.name ? std::string() : candidate.name;
  const auto occupant = findByName(transaction.connection(), row.parent, row.name);
  if (occupant && occupant->id != row.id) transaction.park(occupant->id);
}

void Reconciler::stamp(const Candidate& candidate, ItemRow& row) const {
  if (!candidate.entry.carriesID() || row.id < kFirstIssuedID) return;
  if (candidate.attributes.id == row.id) {
    row.flags |= row_flag::kStamped;
    return;
  }
  const int folder = candidate.folder->get();
  const std::string name = candidate.isOpenedFolder ? "." : candidate.name;
  static FaultPoint beforeStamp("zarn.reconciler.before-stamp");
  if (beforeStamp.hit() || !stampItem(folder, name, row.inode, row.id)) return;
  row.flags |= row_flag::kStamped;
  row.ctime = changeTimeAfterOwnWrite(folder, name, row).value_or(row.ctime);
}

/// What the row kept because the file could not carry it goes to the file as soon as it can.
void Reconciler::giveBack(const Candidate& candidate, ItemRow& row) const {
  if ((row.flags & row_flag::kKeepsExtra) == 0 || !candidate.entry.carriesID()) return;
  const std::string name = candidate.isOpenedFolder ? "." : candidate.name;
  const ItemExtra extra = row.extra ? *row.extra : ItemExtra{};
  if (writeItemExtra(candidate.folder->get(), name, row.inode, extra) != 0) return;
  row.flags &= ~row_flag::kKeepsExtra;
}

bool Reconciler::storeChanged(WriteTransaction& transaction, const Candidate& candidate,
                              const ItemRow& before) {
  ItemRow after = before;
  describe(candidate, after);
  if (before.inode == after.inode && transaction.isBusy(after.inode)) keepContent(before, after);
  if (!isSameContent(before, after)) after.flags &= ~row_flag::kUploaded;
  const bool isPlace = before.parent == kNoParent || before.isContainerFolder();
  const bool isElsewhereNow =
      before.parent != candidate.parent || before.nameOnDisk() != candidate.name;
  if (!isPlace && isElsewhereNow) choosePlace(transaction, candidate, after);
  giveBack(candidate, after);
  stamp(candidate, after);
  if (isShownDifferently(before, after)) {
    if (!transaction.update(before, after)) return false;
  } else if (before.ctime != after.ctime || before.inode != after.inode ||
             before.flags != after.flags) {
    transaction.updateQuietly(after);
  }
  return true;
}

}  // namespace yomber
