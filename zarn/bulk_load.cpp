#include "zarn/bulk_load.h"

#include "zarn/change_feed.h"
#include "zarn/row_queries.h"
#include "zarn/schema.h"

namespace yomber {

BulkLoad::BulkLoad(const std::string& path, std::uint64_t rank, std::int64_t now)
    : path_(path), connection_(path, Connection::Mode::Bulk), rank_(rank), now_(now) {
  createTables(connection_);
  insert_ = &connection_.prepared(kInsertRow);
  connection_.execute("BEGIN");
}

void BulkLoad::add(ItemRow& row, std::string_view nameKey) {
  row.rank = ++rank_;
  ++count_;
  if (row.extra) row.flags |= row_flag::kHasExtra;
  bindRow(*insert_, row, nameKey);
  insert_->run();
  if (row.extra) writeExtra(connection_, row);
  if (!isWorkingSetMember(row, now_)) return;
  StatementUse member(
      connection_.prepared("INSERT INTO working(id,rank,kind,member) VALUES(?1,?2,?3,1)"));
  member->bindID(1, row.id);
  member->bindID(2, row.rank);
  member->bindInteger(3, static_cast<std::int64_t>(row.kind));
  member->step();
}

void BulkLoad::finish() {
  createIndexes(connection_);
  setMetaInteger(connection_, meta::kRank, static_cast<std::int64_t>(rank_));
  setMetaInteger(connection_, meta::kIsComplete, 1);
  connection_.execute("COMMIT");
}

}  // namespace yomber
