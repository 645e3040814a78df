#include "zarn/stamper.h"

#include <fcntl.h>

#include <functional>
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

struct Stamping {
  const ItemRow* row = nullptr;  ///< of the batch
  bool isMarked = false;
  std::int64_t ctime = 0;  ///< to remember
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
bool mark(int folder, const ItemRow& row) {
  const std::string& name = row.nameOnDisk();
  FolderEntry before;
  if (!lookAtEntry(folder, name.c_str(), before) || !before.carriesID()) return false;
  const bool isStill = before.inode == row.inode && before.btime == row.btime &&
                       before.mtime == row.mtime && before.size == row.size;
  return isStill && stampItem(folder, name, row.inode, row.id);
}

/// Does something with each whose folder can be opened.
void forEachInFolder(FolderOpener& folders, std::vector<Stamping>& items,
                     const std::function<void(int folder, Stamping& item)>& action) {
  std::uint64_t folder = kNoParent;
  std::shared_ptr<const FileDescriptor> opened;
  for (Stamping& item : items) {
    if (item.row->parent != folder) {
      folder = item.row->parent;
      opened = folders.open(folder);
    }
    if (opened) action(opened->get(), item);
  }
}

std::vector<Stamping> stamp(const ItemStore& store, const std::vector<ItemRow>& rows) {
  std::vector<Stamping> items;
  for (const ItemRow& row : rows) {
    if (isToBeStamped(row) && row.parent != kNoParent)
      items.push_back({.row = &row, .ctime = row.ctime});
  }
  FolderOpener folders(store);
  forEachInFolder(folders, items,
                  [](int folder, Stamping& item) { item.isMarked = mark(folder, *item.row); });
  std::erase_if(items, [](const Stamping& item) { return !item.isMarked; });
  if (items.empty()) return items;
  waitForTick();
  forEachInFolder(folders, items, [](int folder, Stamping& item) {
    const ItemRow& row = *item.row;
    item.ctime = changeTimeAfterOwnWrite(folder, row.nameOnDisk(), row).value_or(row.ctime);
  });
  return items;
}

NSErrorRef store(WriteTransaction& transaction, const std::vector<Stamping>& stamped,
                 std::int64_t end) {
  for (const Stamping& item : stamped) {
    auto row = findByID(transaction.connection(), item.row->id);
    if (!row) continue;
    row->flags |= row_flag::kStamped;
    // A scan that came in between has a newer time.
    if (row->ctime == item.row->ctime) row->ctime = item.ctime;
    transaction.updateQuietly(*row);
  }
  setMetaInteger(transaction.connection(), meta::kStampedUpTo, end);
  return nullptr;
}

}  // namespace

NSErrorRef Stamper::stampSome(std::uint32_t limit, std::uint32_t& count) {
  count = 0;
  LockGuard guard(mutex_);
  Batch batch;
  if (NSErrorRef error = readBatch(*store_->database(), limit, batch)) return error;
  if (batch.rows.empty()) return nullptr;
  const std::vector<Stamping> stamped = stamp(*store_, batch.rows);
  NSErrorRef error = store_->database()->write(
      [&](WriteTransaction& transaction) { return store(transaction, stamped, batch.end); });
  if (!error) count = static_cast<std::uint32_t>(batch.rows.size());
  return error;
}

}  // namespace yomber
