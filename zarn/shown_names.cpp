#include "zarn/shown_names.h"

#include "zarn/row_queries.h"

namespace yomber {

std::optional<ShownNamesPosition> readShownNames(Connection& connection,
                                                 const std::optional<ShownNamesPosition>& after,
                                                 std::size_t limit, std::vector<ShownName>& out) {
  // Names that differ are few: their index is read, never the items.
  StatementUse statement(connection.prepared(
      "SELECT item.parent,item.disk_name,item.name,folder.inode"
      " FROM item INDEXED BY item_disk_name CROSS JOIN item AS folder ON folder.id=item.parent"
      " WHERE item.disk_name IS NOT NULL AND (item.parent,item.disk_name)>(?1,?2)"
      " ORDER BY item.parent,item.disk_name LIMIT ?3"));
  const ShownNamesPosition begin = after.value_or(ShownNamesPosition{});
  statement->bindInteger(1, after ? static_cast<std::int64_t>(begin.folder) : -1);
  statement->bindBytes(2, begin.diskName);
  statement->bindInteger(3, static_cast<std::int64_t>(limit));
  ShownNamesPosition last;
  std::size_t count = 0;
  for (; statement->step(); ++count) {
    last = {.folder = statement->id(0), .diskName = std::string(statement->bytes(1))};
    out.push_back({.folder = statement->id(3),
                   .name = last.diskName,
                   .shownName = std::string(statement->bytes(2)),
                   .location = {}});
  }
  if (count < limit) return std::nullopt;
  return last;
}

bool hasShownNames(Connection& connection, std::uint64_t folder) {
  StatementUse statement(
      connection.prepared("SELECT 1 FROM item INDEXED BY item_disk_name"
                          " WHERE parent=?1 AND disk_name IS NOT NULL LIMIT 1"));
  statement->bindID(1, folder);
  return statement->step();
}

void readShownContainers(Connection& connection, const TreeLayout& layout,
                         std::vector<ShownName>& out) {
  for (const ItemRow& row : findContainerFolders(connection)) {
    out.push_back({.folder = row.inode,
                   .name = {},
                   .shownName = row.name,
                   .location = layout.documents(row.extra->containerID)});
  }
}

}  // namespace yomber
