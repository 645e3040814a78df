#include "zarn/stamper.h"

#include <fcntl.h>

#include <vector>

#include "zarn/change_times.h"
#include "zarn/connection.h"
#include "zarn/folder_opener.h"
#include "zarn/folder_snapshot.h"
#include "zarn/row_queries.h"
#include "zarn/schema.h"
#include "zarn/write_transaction.h"

namespace yomber {
namespace {

struct Stamped {
  std::uint64_t id = 0;
  std::int64_t ctimeBefore = 0;
  std::int64_t ctime = 0;
};

struct Batch {
  std::vector<ItemRow> rows;
  std::int64_t end = 0;  ///< the last row's number
};

NSErrorRef readBatch(const Database& database, std::uint32_t limit, Batch& batch) {
  return database.read([&](Connection& connection) {
    batch.end = metaInteger(connection, meta::kStampedUpTo);
    StatementUse statement(connection.prepared(
        "SELECT " YOMBER_ROW_COLUMNS ",seq FROM item WHERE seq>?1 ORDER BY seq LIMIT ?2"));
    statement->bindInteger(1, batch.end);
    statement->bindInteger(2, limit);
    while (statement->step()) {
      readRow(*statement, batch.rows.emplace_back());
      batch.end = statement->integer(kRowColumnCount);
    }
    for (ItemRow& row : batch.rows) loadExtra(connection, row);
  });
}

bool isToBeStamped(const ItemRow& row) {
  const bool carriesID = row.isFolder() || row.kind == ItemKind::Document;
  return carriesID && row.id >= kFirstIssuedID && (row.flags & row_flag::kStamped) == 0;
}

/// Marks one file, provided that it is still the one that the row describes.
bool stampRow(int folder, const std::string& name, const ItemRow& row, Stamped& out) {
  FolderEntry before;
  if (!lookAtEntry(folder, name.c_str(), before) || !before.carriesID()) return false;
  const bool isStill = before.inode == row.inode && before.btime == row.btime &&
                       before.mtime == row.mtime && before.size == row.size;
  if (!isStill || !stampItem(folder, name, row.inode, row.id)) return false;
  out = {row.id, row.ctime, changeTimeAfterOwnWrite(folder, name, row).value_or(row.ctime)};
  return true;
}

NSErrorRef store(WriteTransaction& transaction, const std::vector<Stamped>& stamped,
                 std::int64_t end) {
  for (const Stamped& item : stamped) {
    auto row = findByID(transaction.connection(), item.id);
    if (!row) continue;
    row->flags |= row_flag::kStamped;
    // A scan that came in between has a newer time.
    if (row->ctime == item.ctimeBefore) row->ctime = item.ctime;
    transaction.updateQuietly(*row);
  }
  setMetaInteger(transaction.connection(), meta::kStampedUpTo, end);
  return nullptr;
}

}  // namespace

std::uint32_t Stamper::stampSome(std::uint32_t limit) {
  LockGuard guard(mutex_);
  Batch batch;
  if (readBatch(*store_->database(), limit, batch) || batch.rows.empty()) return 0;
  std::vector<Stamped> stamped;
  std::uint64_t folder = kNoParent;
  std::shared_ptr<const FileDescriptor> opened;
  FolderOpener folders(*store_);
  for (const ItemRow& row : batch.rows) {
    if (!isToBeStamped(row) || row.parent == kNoParent) continue;
    if (row.parent != folder) {
      folder = row.parent;
      opened = folders.open(folder);
    }
    Stamped item;
    if (opened && stampRow(opened->get(), row.nameOnDisk(), row, item)) stamped.push_back(item);
  }
  const NSErrorRef error = store_->database()->write(
      [&](WriteTransaction& transaction) { return store(transaction, stamped, batch.end); });
  return error ? 0 : static_cast<std::uint32_t>(batch.rows.size());
}

}  // namespace yomber
