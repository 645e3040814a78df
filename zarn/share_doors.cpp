#include "zarn/share_doors.h"

#include <optional>
#include <string>

#include "zarn/content/share_errors.h"
#include "zarn/content/share_rows.h"
#include "zarn/database.h"

namespace yomber {
namespace {

/// The share that the item is in, when the account may only read it.
std::optional<ShareRow> readOnlyShare(const ItemStore& store, std::uint64_t id) {
  std::optional<ShareRow> share;
  (void)store.database()->read(
      [&](Connection& connection) { share = findShareAbove(connection, id); });
  if (share && share->mayWrite) share.reset();
  return share;
}

}  // namespace

NSErrorRef refusedByShare(const ItemStore& store, const ItemRow& row, std::string_view path) {
  const auto share = readOnlyShare(store, row.id);
  if (!share || share->root == row.id) return nullptr;
  return mayOnlyReadError(std::string(path), share->title);
}

NSErrorRef refusedInFolder(const ItemStore& store, const ItemRow& folder, std::string_view path) {
  const auto share = readOnlyShare(store, folder.id);
  return share ? mayOnlyReadError(std::string(path), share->title) : nullptr;
}

}  // namespace yomber
