#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "zarn/connection.h"
#include "zarn/item_row.h"

namespace yomber {

// How rows are read and written, for whoever holds a connection. All throw SQLite::Exception.

/// The columns that `readRow` expects first in a SELECT, in its order.
#define YOMBER_ROW_COLUMNS \
  "id,parent,kind,flags,size,age,btime,inode,ctime,mode,rank,name,disk_name"
inline constexpr int kRowColumnCount = 13;

/// The statement's row. `extra` is left out; see `loadExtra`.
void readRow(const Statement& statement, ItemRow& out);
/// Fills in `extra` where the row has one.
void loadExtra(Connection& connection, ItemRow& row);

/// Binds parameters 1 to 14: the columns above, then the sort key. What is bound must outlive the
/// step.
void bindRow(Statement& statement, const ItemRow& row, std::string_view nameKey);
inline constexpr const char* kInsertRow =
    "INSERT INTO item(" YOMBER_ROW_COLUMNS
    ",name_key) VALUES(?1,?2,?3,?4,?5,?6,?7,?8,?9,?10,?11,?12,?13,?14)";
/// Writes `row.extra`, or takes it away.
void writeExtra(Connection& connection, const ItemRow& row);

[[nodiscard]] std::optional<ItemRow> findByID(Connection& connection, std::uint64_t id);
[[nodiscard]] std::optional<ItemRow> findByName(Connection& connection, std::uint64_t parent,
                                                std::string_view name);
/// By the name on this disk.
[[nodiscard]] std::optional<ItemRow> findByDiskName(Connection& connection, std::uint64_t parent,
                                                    std::string_view diskName);
[[nodiscard]] std::vector<ItemRow> findByInode(Connection& connection, std::uint64_t inode);
[[nodiscard]] std::vector<ItemRow> findChildren(Connection& connection, std::uint64_t parent);
[[nodiscard]] std::optional<ItemRow> findByContainer(Connection& connection,
                                                     std::string_view containerID);
/// The rows with their own folder in the root.
[[nodiscard]] std::vector<ItemRow> findContainerFolders(Connection& connection);
/// Siblings whose names the collation does not tell apart from the name of `nameKey`.
[[nodiscard]] std::vector<ItemRow> findSameCollation(Connection& connection, std::uint64_t parent,
                                                     std::string_view nameKey);

/// A chain from an item up to its place: names on the way, and what the place is.
struct ItemChain {
  std::vector<ItemRow> rows;  ///< the item first; the last one's parent is the root or the trash
  std::uint64_t place = kRootID;  ///< kRootID or kTrashID
};
/// Nothing when the item, or one above it, is not there.
[[nodiscard]] std::optional<ItemChain> findChain(Connection& connection, std::uint64_t id);

/// Tags as one stored text, and back. Tags hold no comma.
[[nodiscard]] std::string joinTags(const std::vector<std::string>& tags);
[[nodiscard]] std::vector<std::string> splitTags(std::string_view text);

}  // namespace yomber
