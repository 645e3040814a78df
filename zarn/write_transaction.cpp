#include "zarn/write_transaction.h"

#include <algorithm>
#include <limits>
#include <utility>

#include "zarn/change_feed.h"
#include "zarn/name_collation.h"
#include "zarn/random_id.h"
#include "zarn/row_queries.h"

namespace yomber {
namespace {

void setFlag(ItemRow& row, std::uint32_t flag, bool on) {
  row.flags = on ? row.flags | flag : row.flags & ~flag;
}

ItemChange changeOf(const ItemRow& before, ItemRow after) {
  return {.row = std::move(after),
          .parentBefore = before.parent,
          .nameBefore = before.name,
          .diskNameBefore = before.diskName,
          .inodeBefore = before.inode};
}

/// Whether an item could be in the working set at some time: only then its entry is looked for.
bool mayBeMember(const ItemRow& row) {
  return row.extra != nullptr || (row.flags & row_flag::kShared) != 0;
}

/// Drops the oldest rows of a table of ranks beyond the bound; answers the last rank dropped.
std::uint64_t pruneRanks(Connection& connection, const char* count, const char* last,
                         const char* erase) {
  StatementUse counting(connection.prepared(count));
  counting->step();
  const std::int64_t excess = counting->integer(0) - kMaximumTombstones;
  if (excess <= 0) return 0;
  StatementUse lastRank(connection.prepared(last));
  lastRank->bindInteger(1, excess - 1);
  if (!lastRank->step()) return 0;
  const std::uint64_t rank = lastRank->id(0);
  lastRank->reset();
  StatementUse erasing(connection.prepared(erase));
  erasing->bindID(1, rank);
  erasing->step();
  return rank;
}

}  // namespace

std::uint64_t WriteTransaction::issueID() {
  for (;;) {
    const std::uint64_t id = randomID();
    if (!findByID(connection_, id)) return id;
  }
}

void WriteTransaction::insert(ItemRow& row) {
  setFlag(row, row_flag::kTrashed, isInTrash(row.parent));
  setFlag(row, row_flag::kHasExtra, row.extra != nullptr);
  row.rank = nextRank();
  const std::string key = nameSortKey(row.name);
  StatementUse statement(connection_.prepared(kInsertRow));
  bindRow(*statement, row, key);
  statement->step();
  if (row.extra) writeExtra(connection_, row);
  keepWorkingSet(nullptr, row);
  changes_.push_back({.row = row, .isNew = true, .nameBefore = {}, .diskNameBefore = {}});
}

void WriteTransaction::store(const ItemRow& row) {
  const std::string key = nameSortKey(row.name);
  StatementUse statement(connection_.prepared(
      "UPDATE item SET parent=?2,kind=?3,flags=?4,size=?5,age=?6,btime=?7,inode=?8,ctime=?9,"
      "mode=?10,rank=?11,name=?12,disk_name=?13,name_key=?14 WHERE id=?1"));
  bindRow(*statement, row, key);
  statement->step();
}

bool WriteTransaction::update(const ItemRow& before, ItemRow& after) {
  const bool hasMoved = before.parent != after.parent;
  if (hasMoved && after.isFolder() && isBelow(after.parent, after.id)) return false;
  if (hasMoved) setFlag(after, row_flag::kTrashed, isInTrash(after.parent));
  setFlag(after, row_flag::kHasExtra, after.extra != nullptr);
  after.rank = nextRank();
  store(after);
  if (before.extra || after.extra) writeExtra(connection_, after);
  keepWorkingSet(&before, after);
  changes_.push_back(changeOf(before, after));
  if (after.isFolder() && before.isTrashed() != after.isTrashed()) {
    markBelow(after.id, after.isTrashed());
  }
  return true;
}

void WriteTransaction::updateQuietly(const ItemRow& row) {
  StatementUse statement(
      connection_.prepared("UPDATE item SET flags=?2,inode=?3,ctime=?4 WHERE id=?1"));
  statement->bindID(1, row.id);
  statement->bindInteger(2, row.flags);
  statement->bindID(3, row.inode);
  statement->bindInteger(4, row.ctime);
  statement->step();
  touched_.push_back(row);
}

void WriteTransaction::remove(const ItemRow& row) {
  // Children go before their folder; as deep as it gets, without recursion.
  std::vector<std::pair<ItemRow, bool>> stack;
  stack.emplace_back(row, false);
  while (!stack.empty()) {
    auto& [item, isOpened] = stack.back();
    if (isOpened || !item.isFolder()) {
      removeOne(item);
      stack.pop_back();
      continue;
    }
    isOpened = true;
    for (ItemRow& child : findChildren(connection_, item.id)) {
      stack.emplace_back(std::move(child), false);
    }
  }
}

void WriteTransaction::removeOne(const ItemRow& row) {
  const bool carriesID = (row.flags & row_flag::kStamped) != 0 || row.isContainerFolder();
  if (!carriesID && row.id >= kFirstIssuedID) recentlyGone_.note(row);
  StatementUse erase(connection_.prepared("DELETE FROM item WHERE id=?1"));
  erase->bindID(1, row.id);
  erase->step();
  ItemRow dead = row;
  dead.flags |= row_flag::kDead;
  dead.rank = nextRank();
  StatementUse tombstone(
      connection_.prepared("INSERT INTO tombstone(rank,id,kind,parent) VALUES(?1,?2,?3,?4)"));
  tombstone->bindID(1, dead.rank);
  tombstone->bindID(2, dead.id);
  tombstone->bindInteger(3, static_cast<std::int64_t>(dead.kind));
  tombstone->bindID(4, dead.parent);
  tombstone->step();
  keepWorkingSet(&row, dead);
  dead.extra = nullptr;
  if (row.extra) writeExtra(connection_, dead);
  dead.extra = row.extra;
  changes_.push_back(changeOf(row, std::move(dead)));
}

void WriteTransaction::markBelow(std::uint64_t folder, bool isTrashed) {
  std::vector<std::uint64_t> folders{folder};
  while (!folders.empty()) {
    const std::uint64_t at = folders.back();
    folders.pop_back();
    for (const ItemRow& child : findChildren(connection_, at)) {
      ItemRow marked = child;
      setFlag(marked, row_flag::kTrashed, isTrashed);
      marked.rank = nextRank();
      store(marked);
      keepWorkingSet(&child, marked);
      if (marked.isFolder()) folders.push_back(marked.id);
      changes_.push_back(changeOf(child, std::move(marked)));
    }
  }
}

void WriteTransaction::park(std::uint64_t id) {
  // 0xff begins no collation key, so a parked key meets no name's.
  const std::string key = '\xff' + std::to_string(id);
  StatementUse statement(connection_.prepared("UPDATE item SET name_key=?2 WHERE id=?1"));
  statement->bindID(1, id);
  statement->bindBytes(2, key);
  statement->step();
}

bool WriteTransaction::isNameTaken(std::uint64_t parent, std::string_view name, std::uint64_t self,
                                   const Ignore& ignore) {
  for (const ItemRow& row : findSameCollation(connection_, parent, nameSortKey(name))) {
    if (row.id == self || (ignore && ignore(row))) continue;
    if (areNormalizationTwins(row.name, name)) return true;
  }
  return false;
}

bool WriteTransaction::isInTrash(std::uint64_t parent) {
  if (parent == kTrashID) return true;
  if (parent == kRootID || parent == kNoParent) return false;
  const auto row = findByID(connection_, parent);
  return row && row->isTrashed();
}

bool WriteTransaction::isBelow(std::uint64_t folder, std::uint64_t ancestor) {
  while (folder != kRootID && folder != kTrashID && folder != kNoParent) {
    if (folder == ancestor) return true;
    const auto row = findByID(connection_, folder);
    if (!row) return false;
    folder = row->parent;
  }
  return false;
}

void WriteTransaction::keepWorkingSet(const ItemRow* before, const ItemRow& after) {
  if (!after.isDead() && isWorkingSetMember(after, now_)) {
    StatementUse statement(connection_.prepared(
        "INSERT OR REPLACE INTO working(id,rank,kind,member) VALUES(?1,?2,?3,1)"));
    statement->bindID(1, after.id);
    statement->bindID(2, after.rank);
    statement->bindInteger(3, static_cast<std::int64_t>(after.kind));
    statement->step();
    return;
  }
  if (before == nullptr || !mayBeMember(*before)) return;
  StatementUse statement(
      connection_.prepared("UPDATE working SET member=0,rank=?2 WHERE id=?1 AND member=1"));
  statement->bindID(1, after.id);
  statement->bindID(2, after.rank);
  statement->step();
}

void WriteTransaction::departFromWorkingSet(std::uint64_t id) {
  const std::uint64_t rank = nextRank();
  StatementUse statement(
      connection_.prepared("UPDATE working SET member=0,rank=?2 WHERE id=?1 AND member=1"));
  statement->bindID(1, id);
  statement->bindID(2, rank);
  statement->step();
}

void WriteTransaction::rewind(const Mark& mark) {
  rank_ = mark.rank;
  changes_.resize(std::min(changes_.size(), mark.changes));
  touched_.resize(std::min(touched_.size(), mark.touched));
}

std::uint64_t WriteTransaction::prune() {
  pruneRanks(connection_, "SELECT COUNT(*) FROM tombstone",
             "SELECT rank FROM tombstone ORDER BY rank LIMIT 1 OFFSET ?1",
             "DELETE FROM tombstone WHERE rank<=?1");
  return pruneRanks(connection_, "SELECT COUNT(*) FROM working WHERE member=0",
                    "SELECT rank FROM working WHERE member=0 ORDER BY rank LIMIT 1 OFFSET ?1",
                    "DELETE FROM working WHERE member=0 AND rank<=?1");
}

}  // namespace yomber
