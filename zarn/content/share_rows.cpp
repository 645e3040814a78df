#include "zarn/content/share_rows.h"

#include <algorithm>
#include <utility>

#include "platform/rozzel/share.h"
#include "zarn/content/content_rows.h"
#include "zarn/row_queries.h"

namespace yomber {
namespace {

#define YOMBER_SHARE_COLUMNS "root,account,zone,owner,state,writable,folder,title,token,zone_tag"

constexpr std::int64_t kSecond = 1'000'000'000;
constexpr std::int64_t kFirstPause = 3 * kSecond;
constexpr std::int64_t kLongestPause = 3'600 * kSecond;
/// A record that cannot be placed in some three hours is one whose folder nobody will bring, or
/// none of ours to understand.
constexpr std::int64_t kAttemptsForWaiting = 12;

ShareRow readShare(const Statement& statement) {
  ShareRow row;
  row.root = statement.id(0);
  row.account = statement.integer(1);
  row.zone = RZRecordZoneID(std::string(statement.bytes(2)), std::string(statement.bytes(3)));
  row.state = static_cast<ShareRow::State>(statement.integer(4));
  row.mayWrite = statement.integer(5) != 0;
  row.isFolder = statement.integer(6) != 0;
  row.title = statement.bytes(7);
  row.token = statement.bytes(8);
  row.zoneTag = statement.bytes(9);
  return row;
}

}  // namespace

bool hasShares(Connection& connection) {
  StatementUse statement(connection.prepared("SELECT 1 FROM share LIMIT 1"));
  return statement->step();
}

std::optional<ShareRow> findShare(Connection& connection, std::uint64_t root) {
  StatementUse statement(
      connection.prepared("SELECT " YOMBER_SHARE_COLUMNS " FROM share WHERE root=?1"));
  statement->bindID(1, root);
  if (!statement->step()) return std::nullopt;
  return readShare(*statement);
}

std::optional<ShareRow> findShareOfZone(Connection& connection, std::int64_t account,
                                        const RZRecordZoneID& zone) {
  StatementUse statement(connection.prepared(
      "SELECT " YOMBER_SHARE_COLUMNS " FROM share WHERE account=?1 AND zone=?2 AND owner=?3"));
  statement->bindInteger(1, account);
  statement->bindBytes(2, zone.zoneName());
  statement->bindBytes(3, zone.ownerName());
  if (!statement->step()) return std::nullopt;
  return readShare(*statement);
}

std::vector<ShareRow> findShares(Connection& connection, std::int64_t account) {
  StatementUse statement(connection.prepared("SELECT " YOMBER_SHARE_COLUMNS
                                             " FROM share WHERE account=?1 ORDER BY zone,owner"));
  statement->bindInteger(1, account);
  std::vector<ShareRow> rows;
  while (statement->step()) rows.push_back(readShare(*statement));
  return rows;
}

std::vector<ShareRow> findShares(Connection& connection) {
  StatementUse statement(
      connection.prepared("SELECT " YOMBER_SHARE_COLUMNS " FROM share ORDER BY root"));
  std::vector<ShareRow> rows;
  while (statement->step()) rows.push_back(readShare(*statement));
  return rows;
}

std::optional<ShareRow> findShareAbove(Connection& connection, std::uint64_t id) {
  if (!hasShares(connection)) return std::nullopt;
  const auto chain = findChain(connection, id);
  if (!chain) return findShare(connection, id);
  for (const ItemRow& row : chain->rows) {
    if (auto share = findShare(connection, row.id)) return share;
  }
  return std::nullopt;
}

ZoneSource findZoneSource(Connection& connection, const std::vector<ItemRow>& rows,
                          std::optional<std::int64_t> account) {
  bool mayBeShared = hasShares(connection);
  for (const ItemRow& row : rows) {
    auto share = mayBeShared ? findShare(connection, row.id) : std::nullopt;
    if (share && givesItsZone(*share)) {
      if (!account || share->account == *account)
        return {.zone = share->zone, .share = std::move(share)};
      mayBeShared = false;  // the nearest one decides
    }
    if (row.isContainerFolder())
      return {.zone = RZRecordZoneID(row.extra->containerID), .share = std::nullopt};
  }
  return {};
}

void storeShare(Connection& connection, const ShareRow& row) {
  StatementUse statement(connection.prepared("INSERT OR REPLACE INTO share(" YOMBER_SHARE_COLUMNS
                                             ") VALUES(?1,?2,?3,?4,?5,?6,?7,?8,?9,?10)"));
  statement->bindID(1, row.root);
  statement->bindInteger(2, row.account);
  statement->bindBytes(3, row.zone.zoneName());
  statement->bindBytes(4, row.zone.ownerName());
  statement->bindInteger(5, static_cast<std::int64_t>(row.state));
  statement->bindInteger(6, row.mayWrite ? 1 : 0);
  statement->bindInteger(7, row.isFolder ? 1 : 0);
  statement->bindBytes(8, row.title);
  statement->bindBytes(9, row.token);
  statement->bindBytes(10, row.zoneTag);
  statement->step();
}

void removeShare(Connection& connection, std::uint64_t root) {
  for (const char* sql :
       {"DELETE FROM share WHERE root=?1", "DELETE FROM share_waiting WHERE root=?1"}) {
    Statement statement(connection.database(), sql);
    statement.bindID(1, root);
    statement.run();
  }
}

bool isSharedZone(const RZRecordZoneID& zone) {
  return zone.ownerName() != RZCurrentUserDefaultName ||
         zone.zoneName().starts_with(RZShareZonePrefix);
}

std::uint64_t countContentIn(Connection& connection, const RZRecordZoneID& zone) {
  StatementUse statement(connection.prepared(
      "SELECT COUNT(*) FROM content WHERE owner IS NOT NULL AND zone=?1 AND owner=?2"));
  statement->bindBytes(1, zone.zoneName());
  statement->bindBytes(2, zone.ownerName());
  return statement->step() ? statement->id(0) : 0;
}

std::vector<std::uint64_t> contentIn(Connection& connection, const RZRecordZoneID& zone) {
  StatementUse statement(connection.prepared(
      "SELECT id FROM content WHERE owner IS NOT NULL AND zone=?1 AND owner=?2"));
  statement->bindBytes(1, zone.zoneName());
  statement->bindBytes(2, zone.ownerName());
  std::vector<std::uint64_t> ids;
  while (statement->step()) ids.push_back(statement->id(0));
  return ids;
}

std::vector<std::uint64_t> findLostContent(Connection& connection, const ShareRow& share) {
  StatementUse statement(connection.prepared(
      "SELECT id FROM content WHERE owner IS NOT NULL AND zone=?1 AND owner=?2 AND account=?3 "
      "AND id<>?4 AND NOT EXISTS(SELECT 1 FROM item WHERE item.id=content.id) "
      "AND NOT EXISTS(SELECT 1 FROM job WHERE job.item=content.id AND kind=?5) "
      "AND NOT EXISTS(SELECT 1 FROM share_waiting WHERE root=?4 AND record=content.id)"));
  statement->bindBytes(1, share.zone.zoneName());
  statement->bindBytes(2, share.zone.ownerName());
  statement->bindInteger(3, share.account);
  statement->bindID(4, share.root);
  statement->bindInteger(5, static_cast<std::int64_t>(JobKind::Upload));
  std::vector<std::uint64_t> ids;
  while (statement->step()) ids.push_back(statement->id(0));
  return ids;
}

void addWaitingRecord(Connection& connection, std::uint64_t root, std::uint64_t record) {
  StatementUse statement(
      connection.prepared("INSERT OR REPLACE INTO share_waiting(root,record) VALUES(?1,?2)"));
  statement->bindID(1, root);
  statement->bindID(2, record);
  statement->step();
}

void keepWaitingRecord(Connection& connection, std::uint64_t root, std::uint64_t record) {
  StatementUse statement(
      connection.prepared("INSERT OR IGNORE INTO share_waiting(root,record) VALUES(?1,?2)"));
  statement->bindID(1, root);
  statement->bindID(2, record);
  statement->step();
}

void postponeWaitingRecord(Connection& connection, std::uint64_t root, std::uint64_t record,
                           std::int64_t now) {
  std::int64_t attempts = 0;
  {
    StatementUse statement(
        connection.prepared("SELECT attempts FROM share_waiting WHERE root=?1 AND record=?2"));
    statement->bindID(1, root);
    statement->bindID(2, record);
    if (statement->step()) attempts = statement->integer(0);
  }
  const bool isLast = attempts >= kAttemptsForWaiting;
  const std::int64_t pause =
      std::min(kFirstPause << std::min(attempts, kAttemptsForWaiting), kLongestPause);
  StatementUse statement(connection.prepared(
      "INSERT OR REPLACE INTO share_waiting(root,record,attempts,due) VALUES(?1,?2,?3,?4)"));
  statement->bindID(1, root);
  statement->bindID(2, record);
  statement->bindInteger(3, isLast ? attempts : attempts + 1);
  statement->bindInteger(4, isLast ? kNeverDue : now + pause);
  statement->step();
}

void removeWaitingRecord(Connection& connection, std::uint64_t root, std::uint64_t record) {
  StatementUse statement(
      connection.prepared("DELETE FROM share_waiting WHERE root=?1 AND record=?2"));
  statement->bindID(1, root);
  statement->bindID(2, record);
  statement->step();
}

void makeWaitingRecordsDue(Connection& connection, std::uint64_t root) {
  StatementUse statement(
      connection.prepared("UPDATE share_waiting SET due=0 WHERE root=?1 AND due>0"));
  statement->bindID(1, root);
  statement->step();
}

void makeAllWaitingRecordsDue(Connection& connection, std::int64_t account) {
  StatementUse statement(
      connection.prepared("UPDATE share_waiting SET due=0 WHERE due>0 AND root IN "
                          "(SELECT root FROM share WHERE account=?1)"));
  statement->bindInteger(1, account);
  statement->step();
}

bool hasPostponedRecords(Connection& connection, std::int64_t account) {
  StatementUse statement(
      connection.prepared("SELECT 1 FROM share CROSS JOIN share_waiting ON "
                          "share_waiting.root=share.root WHERE account=?1 AND due>0 LIMIT 1"));
  statement->bindInteger(1, account);
  return statement->step();
}

bool hasWaitingRecords(Connection& connection, std::uint64_t root) {
  StatementUse statement(connection.prepared("SELECT 1 FROM share_waiting WHERE root=?1 LIMIT 1"));
  statement->bindID(1, root);
  return statement->step();
}

std::vector<std::uint64_t> findWaitingRecords(Connection& connection, std::uint64_t root,
                                              std::int64_t now, std::size_t limit) {
  // Those of one time in any order: some that stay due must not keep the others from their turn.
  StatementUse statement(
      connection.prepared("SELECT record FROM share_waiting WHERE root=?1 AND due<=?2 "
                          "ORDER BY due,random() LIMIT ?3"));
  statement->bindID(1, root);
  statement->bindInteger(2, now);
  statement->bindInteger(3, static_cast<std::int64_t>(limit));
  std::vector<std::uint64_t> records;
  while (statement->step()) records.push_back(statement->id(0));
  return records;
}

}  // namespace yomber
