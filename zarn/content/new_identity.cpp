#include "zarn/content/new_identity.h"

#include <cerrno>
#include <optional>

#include "platform/foundation/log.h"
#include "zarn/row_queries.h"
#include "zarn/write_transaction.h"

namespace yomber {
namespace {

/// What nobody but the store has stays known of it. So does the record, under the id that it has:
/// whoever sees that item go has it removed.
void storeRenewed(Connection& connection, const ItemRow& before, std::uint64_t id) {
  auto content = findContent(connection, before.id);
  if (!content) return;
  content->id = id;
  content->zone = RZRecordZoneID();
  content->tag.clear();
  const bool isHere = (before.flags & row_flag::kDownloaded) != 0;
  if (isHere || before.isFolder()) content->content.reset();
  storeContent(connection, *content);
}

/// The new id; nothing when there is no such item.
std::optional<std::uint64_t> renew(WriteTransaction& transaction, std::uint64_t id) {
  Connection& connection = transaction.connection();
  const auto before = findByID(connection, id);
  if (!before) return std::nullopt;
  ItemRow row = *before;
  row.id = transaction.issueID();
  row.flags &= ~(row_flag::kStamped | row_flag::kUploaded);
  --row.ctime;  // the next look finds it changed, and marks it with its id
  storeRenewed(connection, *before, row.id);
  transaction.park(id);
  transaction.insert(row);
  for (const ItemRow& child : findChildren(connection, id)) {
    ItemRow moved = child;
    moved.parent = row.id;
    (void)transaction.update(child, moved);
  }
  transaction.remove(*before);
  return row.id;
}

}  // namespace

NSErrorRef giveNewIdentity(ContentCore& core, std::uint64_t id) {
  std::optional<std::uint64_t> renewed;
  NSErrorRef error = core.database().write([&](WriteTransaction& transaction) {
    renewed = renew(transaction, id);
    return NSErrorRef();
  });
  const auto path = renewed && !error ? core.items->physicalPath(*renewed) : std::nullopt;
  if (error || !path) return error;
  log_default(defaultLog(), "[NOTICE] %@ is an item of its own from now on", *path);
  const auto row = core.scanner->scanLocation(*path);
  // Whoever observes it knows it by its id.
  if (row && row->isFolder()) error = core.scanner->scanSubtree(row->id);
  for (const auto& completion : core.wishes.take(id)) {
    if (completion) completion(NSError::errorWithErrno(EAGAIN, *path));
  }
  return error;
}

}  // namespace yomber
