#include "zarn/row_queries.h"

#include <unordered_set>

#include "zarn/name_collation.h"

namespace yomber {
namespace {

std::optional<ItemRow> firstRow(Connection& connection, Statement& statement) {
  if (!statement.step()) return std::nullopt;
  ItemRow row;
  readRow(statement, row);
  loadExtra(connection, row);
  return row;
}

std::vector<ItemRow> allRows(Connection& connection, Statement& statement) {
  std::vector<ItemRow> rows;
  while (statement.step()) {
    rows.emplace_back();
    readRow(statement, rows.back());
  }
  for (ItemRow& row : rows) loadExtra(connection, row);
  return rows;
}

/// Without overflow at the one value that has no counterpart.
std::int64_t negated(std::int64_t value) {
  return static_cast<std::int64_t>(0 - static_cast<std::uint64_t>(value));
}

std::optional<std::int64_t> optionalInteger(const Statement& statement, int column) {
  if (statement.isNull(column)) return std::nullopt;
  return statement.integer(column);
}

void bindOptional(Statement& statement, int parameter, const std::optional<std::int64_t>& value) {
  if (value) {
    statement.bindInteger(parameter, *value);
  } else {
    statement.bindNull(parameter);
  }
}

}  // namespace

void readRow(const Statement& statement, ItemRow& out) {
  out.id = statement.id(0);
  out.parent = statement.id(1);
  out.kind = static_cast<ItemKind>(statement.integer(2));
  out.flags = static_cast<std::uint32_t>(statement.integer(3));
  out.size = statement.id(4);
  out.mtime = negated(statement.integer(5));
  out.btime = statement.integer(6);
  out.inode = statement.id(7);
  out.ctime = statement.integer(8);
  out.mode = static_cast<std::uint32_t>(statement.integer(9));
  out.rank = statement.id(10);
  out.name = statement.bytes(11);
  out.diskName = statement.bytes(12);
}

void loadExtra(Connection& connection, ItemRow& row) {
  if ((row.flags & row_flag::kHasExtra) == 0) return;
  StatementUse statement(
      connection.prepared("SELECT tags,favorite,last_used,container_id FROM extra WHERE id=?1"));
  statement->bindID(1, row.id);
  if (!statement->step()) return;
  ItemExtra extra;
  extra.tags = splitTags(statement->bytes(0));
  extra.favoriteRank = optionalInteger(*statement, 1);
  extra.lastUsed = optionalInteger(*statement, 2);
  extra.containerID = statement->bytes(3);
  row.extra = std::make_shared<const ItemExtra>(std::move(extra));
}

void bindRow(Statement& statement, const ItemRow& row, std::string_view nameKey) {
  statement.bindID(1, row.id);
  statement.bindID(2, row.parent);
  statement.bindInteger(3, static_cast<std::int64_t>(row.kind));
  statement.bindInteger(4, row.flags);
  statement.bindID(5, row.size);
  statement.bindInteger(6, negated(row.mtime));
  statement.bindInteger(7, row.btime);
  statement.bindID(8, row.inode);
  statement.bindInteger(9, row.ctime);
  statement.bindInteger(10, row.mode);
  statement.bindID(11, row.rank);
  statement.bindBytes(12, row.name);
  if (row.diskName.empty()) {
    statement.bindNull(13);
  } else {
    statement.bindBytes(13, row.diskName);
  }
  statement.bindBytes(14, nameKey);
}

void writeExtra(Connection& connection, const ItemRow& row) {
  if (!row.extra) {
    StatementUse statement(connection.prepared("DELETE FROM extra WHERE id=?1"));
    statement->bindID(1, row.id);
    statement->step();
    return;
  }
  const std::string tags = joinTags(row.extra->tags);
  StatementUse statement(
      connection.prepared("INSERT OR REPLACE INTO extra(id,tags,favorite,last_used,container_id) "
                          "VALUES(?1,?2,?3,?4,?5)"));
  statement->bindID(1, row.id);
  statement->bindBytes(2, tags);
  bindOptional(*statement, 3, row.extra->favoriteRank);
  bindOptional(*statement, 4, row.extra->lastUsed);
  if (row.extra->containerID.empty()) {
    statement->bindNull(5);
  } else {
    statement->bindBytes(5, row.extra->containerID);
  }
  statement->step();
}

std::optional<ItemRow> findByID(Connection& connection, std::uint64_t id) {
  StatementUse statement(
      connection.prepared("SELECT " YOMBER_ROW_COLUMNS " FROM item WHERE id=?1"));
  statement->bindID(1, id);
  return firstRow(connection, *statement);
}

std::optional<ItemRow> findByName(Connection& connection, std::uint64_t parent,
                                  std::string_view name) {
  const std::string key = nameSortKey(name);
  StatementUse statement(connection.prepared("SELECT " YOMBER_ROW_COLUMNS
                                             " FROM item WHERE parent=?1 AND name_key=?2"));
  statement->bindID(1, parent);
  statement->bindBytes(2, key);
  return firstRow(connection, *statement);
}

std::optional<ItemRow> findByDiskName(Connection& connection, std::uint64_t parent,
                                      std::string_view diskName) {
  {
    StatementUse statement(connection.prepared("SELECT " YOMBER_ROW_COLUMNS
                                               " FROM item WHERE parent=?1 AND disk_name=?2"));
    statement->bindID(1, parent);
    statement->bindBytes(2, diskName);
    if (auto row = firstRow(connection, *statement)) return row;
  }
  auto row = findByName(connection, parent, diskName);
  // A row with another name on disk, or of a container, only happens to be called so.
  if (row && (!row->diskName.empty() || row->isContainerFolder())) return std::nullopt;
  return row;
}

std::vector<ItemRow> findByInode(Connection& connection, std::uint64_t inode) {
  StatementUse statement(
      connection.prepared("SELECT " YOMBER_ROW_COLUMNS " FROM item WHERE inode=?1"));
  statement->bindID(1, inode);
  return allRows(connection, *statement);
}

std::vector<ItemRow> findChildren(Connection& connection, std::uint64_t parent) {
  StatementUse statement(
      connection.prepared("SELECT " YOMBER_ROW_COLUMNS " FROM item WHERE parent=?1"));
  statement->bindID(1, parent);
  return allRows(connection, *statement);
}

std::optional<ItemRow> findByContainer(Connection& connection, std::string_view containerID) {
  StatementUse statement(connection.prepared("SELECT id FROM extra WHERE container_id=?1"));
  statement->bindBytes(1, containerID);
  if (!statement->step()) return std::nullopt;
  return findByID(connection, statement->id(0));
}

std::vector<ItemRow> findContainerFolders(Connection& connection) {
  std::vector<ItemRow> rows;
  StatementUse statement(
      connection.prepared("SELECT id FROM extra WHERE container_id IS NOT NULL"));
  while (statement->step()) {
    if (auto row = findByID(connection, statement->id(0))) rows.push_back(std::move(*row));
  }
  return rows;
}

std::vector<ItemRow> findSameCollation(Connection& connection, std::uint64_t parent,
                                       std::string_view nameKey) {
  const std::string begin(sortKeyCollationPart(nameKey));
  std::string end = begin;
  if (!end.empty()) end.back() = '\1';
  StatementUse statement(connection.prepared(
      "SELECT " YOMBER_ROW_COLUMNS " FROM item WHERE parent=?1 AND name_key>=?2 AND name_key<?3"));
  statement->bindID(1, parent);
  statement->bindBytes(2, begin);
  statement->bindBytes(3, end);
  return allRows(connection, *statement);
}

std::optional<ItemChain> findChain(Connection& connection, std::uint64_t id) {
  ItemChain chain;
  for (std::uint64_t at = id; at != kRootID && at != kTrashID;) {
    auto row = findByID(connection, at);
    if (!row) return std::nullopt;
    at = row->parent;
    chain.rows.push_back(std::move(*row));
    chain.place = at;
  }
  if (chain.rows.empty()) chain.place = id;
  return chain;
}

std::string joinTags(const std::vector<std::string>& tags) {
  std::string text;
  for (const std::string& tag : tags) {
    if (!text.empty()) text += ',';
    text += tag;
  }
  return text;
}

std::vector<std::string> splitTags(std::string_view text) {
  std::vector<std::string> tags;
  // Anyone may write 64 KiB of tags of two bytes: looking through those before would take a second.
  std::unordered_set<std::string_view> seen;
  while (!text.empty()) {
    const std::size_t comma = text.find(',');
    std::string_view tag = text.substr(0, comma);
    while (!tag.empty() && tag.front() == ' ') tag.remove_prefix(1);
    while (!tag.empty() && tag.back() == ' ') tag.remove_suffix(1);
    if (!tag.empty() && seen.insert(tag).second) tags.emplace_back(tag);
    text.remove_prefix(comma == std::string_view::npos ? text.size() : comma + 1);
  }
  return tags;
}

}  // namespace yomber
