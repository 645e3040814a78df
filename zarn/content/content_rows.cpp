#include "zarn/content/content_rows.h"

#include <algorithm>
#include <charconv>

#include "platform/ostrell/constants.h"
#include "zarn/content/share_rows.h"
#include "zarn/row_queries.h"

namespace yomber {
namespace {

#define YOMBER_JOB_COLUMNS "seq,item,kind,account,state,attempts,due,created,error"
constexpr int kJobColumns = 9;

Job readJob(const Statement& statement) {
  Job job;
  job.seq = statement.integer(0);
  job.item = statement.id(1);
  job.kind = static_cast<JobKind>(statement.integer(2));
  job.account = statement.integer(3);
  job.state = static_cast<JobState>(statement.integer(4));
  job.attempts = static_cast<std::uint32_t>(statement.integer(5));
  job.due = statement.integer(6);
  job.created = statement.integer(7);
  job.error = decodeError(statement.bytes(8));
  return job;
}

std::vector<Job> readJobs(Statement& statement) {
  std::vector<Job> jobs;
  while (statement.step()) jobs.push_back(readJob(statement));
  return jobs;
}

std::string_view hashBytes(const RZAsset& asset) {
  // Bytes are bytes, whatever their sign.
  return {reinterpret_cast<const char*>(asset.hash.data()), asset.hash.size()};
}

RZRecordZoneID readZone(const Statement& statement, int name, int owner) {
  std::string zone(statement.bytes(name));
  if (statement.isNull(owner)) return RZRecordZoneID(std::move(zone));
  return RZRecordZoneID(std::move(zone), std::string(statement.bytes(owner)));
}

RZAsset readAsset(std::string_view hash, std::uint64_t size) {
  RZAsset asset;
  asset.size = size;
  std::copy_n(hash.begin(), std::min(hash.size(), asset.hash.size()), asset.hash.begin());
  return asset;
}

}  // namespace

void addJob(Connection& connection, std::uint64_t item, JobKind kind, std::int64_t account,
            std::int64_t due, std::int64_t now) {
  StatementUse statement(connection.prepared(
      "INSERT OR REPLACE INTO job(item,kind,account,state,attempts,due,created) "
      "VALUES(?1,?2,?3,0,0,?4,?5)"));
  statement->bindID(1, item);
  statement->bindInteger(2, static_cast<std::int64_t>(kind));
  statement->bindInteger(3, account);
  statement->bindInteger(4, due);
  statement->bindInteger(5, now);
  statement->step();
}

void removeJob(Connection& connection, const Job& job) {
  StatementUse statement(
      connection.prepared("DELETE FROM job WHERE seq=?1 AND item=?2 AND kind=?3"));
  statement->bindInteger(1, job.seq);
  statement->bindID(2, job.item);
  statement->bindInteger(3, static_cast<std::int64_t>(job.kind));
  statement->step();
}

void updateJob(Connection& connection, const Job& job) {
  StatementUse statement(
      connection.prepared("UPDATE job SET state=?4,attempts=?5,due=?6,error=?7 "
                          "WHERE seq=?1 AND item=?2 AND kind=?3"));
  const std::string error = encodeError(job.error);
  statement->bindInteger(1, job.seq);
  statement->bindID(2, job.item);
  statement->bindInteger(3, static_cast<std::int64_t>(job.kind));
  statement->bindInteger(4, static_cast<std::int64_t>(job.state));
  statement->bindInteger(5, job.attempts);
  statement->bindInteger(6, job.due);
  statement->bindBytes(7, error);
  statement->step();
}

void removeJobsOf(Connection& connection, std::uint64_t item) {
  StatementUse statement(connection.prepared("DELETE FROM job WHERE item=?1"));
  statement->bindID(1, item);
  statement->step();
}

std::optional<Job> findJob(Connection& connection, std::uint64_t item, JobKind kind) {
  StatementUse statement(
      connection.prepared("SELECT " YOMBER_JOB_COLUMNS " FROM job WHERE item=?1 AND kind=?2"));
  statement->bindID(1, item);
  statement->bindInteger(2, static_cast<std::int64_t>(kind));
  if (!statement->step()) return std::nullopt;
  return readJob(*statement);
}

std::vector<Job> dueJobs(Connection& connection, std::int64_t account, JobKind kind,
                         std::int64_t now, std::size_t limit) {
  StatementUse statement(connection.prepared(
      "SELECT " YOMBER_JOB_COLUMNS
      ",(SELECT size FROM item WHERE item.id=job.item)"
      " FROM job WHERE account=?1 AND kind=?2 AND due<=?3 ORDER BY due,seq LIMIT ?4"));
  statement->bindInteger(1, account);
  statement->bindInteger(2, static_cast<std::int64_t>(kind));
  statement->bindInteger(3, now);
  statement->bindInteger(4, static_cast<std::int64_t>(limit));
  std::vector<Job> jobs;
  while (statement->step())
    jobs.emplace_back(readJob(*statement)).size = statement->id(kJobColumns);
  return jobs;
}

std::optional<std::int64_t> nextDue(Connection& connection, std::int64_t account, JobKind kind,
                                    std::int64_t after) {
  StatementUse statement(connection.prepared(
      "SELECT due FROM job WHERE account=?1 AND kind=?2 AND due>?3 ORDER BY due LIMIT 1"));
  statement->bindInteger(1, account);
  statement->bindInteger(2, static_cast<std::int64_t>(kind));
  statement->bindInteger(3, after);
  if (!statement->step()) return std::nullopt;
  return statement->integer(0);
}

std::vector<Job> failedJobs(Connection& connection, std::int64_t account, std::size_t limit) {
  // The plus keeps the planner from an index of all jobs.
  StatementUse statement(connection.prepared(
      "SELECT " YOMBER_JOB_COLUMNS
      " FROM job WHERE account=?1 AND state<>0 AND +kind<3 ORDER BY due,seq LIMIT ?2"));
  statement->bindInteger(1, account);
  statement->bindInteger(2, static_cast<std::int64_t>(limit));
  return readJobs(*statement);
}

std::uint64_t countJobs(Connection& connection, std::int64_t account) {
  StatementUse statement(
      connection.prepared("SELECT COUNT(*) FROM job WHERE account=?1 AND kind<3"));
  statement->bindInteger(1, account);
  return statement->step() ? statement->id(0) : 0;
}

void makeAllDue(Connection& connection, std::int64_t account, std::int64_t now) {
  StatementUse statement(
      connection.prepared("UPDATE job SET due=?2 WHERE account=?1 AND state<>0 AND due>?2"));
  statement->bindInteger(1, account);
  statement->bindInteger(2, now);
  statement->step();
}

std::optional<ContentRow> findContent(Connection& connection, std::uint64_t id) {
  StatementUse statement(connection.prepared(
      "SELECT account,pinned,zone,parent,name,hash,tag,size,inode,mtime,ctime,owner FROM content "
      "WHERE id=?1"));
  statement->bindID(1, id);
  if (!statement->step()) return std::nullopt;
  ContentRow row;
  row.id = id;
  row.account = statement->integer(0);
  row.isPinned = statement->integer(1) != 0;
  row.zone = readZone(*statement, 2, 11);
  row.parent = statement->id(3);
  row.name = statement->bytes(4);
  row.stamp.size = statement->id(7);
  if (!statement->isNull(5)) row.content = readAsset(statement->bytes(5), row.stamp.size);
  row.tag = statement->bytes(6);
  row.stamp.inode = statement->id(8);
  row.stamp.mtime = statement->integer(9);
  row.stamp.ctime = statement->integer(10);
  return row;
}

std::optional<RZRecordZoneID> findRecordZone(Connection& connection, std::uint64_t id,
                                             const std::string& account) {
  StatementUse statement(connection.prepared(
      "SELECT content.zone,content.owner FROM content JOIN account ON account.key=content.account "
      "WHERE content.id=?1 AND content.hash IS NOT NULL AND content.tag<>x'' AND account.name=?2"));
  statement->bindID(1, id);
  statement->bindBytes(2, account);
  if (!statement->step()) return std::nullopt;
  return readZone(*statement, 0, 1);
}

void storeContent(Connection& connection, const ContentRow& row) {
  StatementUse statement(connection.prepared(
      "INSERT OR REPLACE INTO content(id,account,pinned,zone,parent,name,hash,tag,size,inode,mtime,"
      "ctime,owner) VALUES(?1,?2,?3,?4,?5,?6,?7,?8,?9,?10,?11,?12,?13)"));
  statement->bindID(1, row.id);
  statement->bindInteger(2, row.account);
  statement->bindInteger(3, row.isPinned ? 1 : 0);
  statement->bindBytes(4, row.zone.zoneName());
  statement->bindID(5, row.parent);
  statement->bindBytes(6, row.name);
  if (row.content) {
    statement->bindBytes(7, hashBytes(*row.content));
  } else {
    statement->bindNull(7);
  }
  statement->bindBytes(8, row.tag);
  statement->bindID(9, row.content ? row.content->size : 0);
  statement->bindID(10, row.stamp.inode);
  statement->bindInteger(11, row.stamp.mtime);
  statement->bindInteger(12, row.stamp.ctime);
  if (isSharedZone(row.zone)) {
    statement->bindBytes(13, row.zone.ownerName());
  } else {
    statement->bindNull(13);
  }
  statement->step();
}

void removeContent(Connection& connection, std::uint64_t id) {
  StatementUse statement(connection.prepared("DELETE FROM content WHERE id=?1"));
  statement->bindID(1, id);
  statement->step();
  removeSavings(connection, id);
}

void storeSaving(Connection& connection, std::uint64_t id, const RZAsset& content,
                 const FileStamp& stamp) {
  StatementUse statement(connection.prepared(
      "INSERT OR REPLACE INTO saving(id,hash,size,inode,mtime,ctime) VALUES(?1,?2,?3,?4,?5,?6)"));
  statement->bindID(1, id);
  statement->bindBytes(2, hashBytes(content));
  statement->bindID(3, content.size);
  statement->bindID(4, stamp.inode);
  statement->bindInteger(5, stamp.mtime);
  statement->bindInteger(6, stamp.ctime);
  statement->step();
}

std::optional<FileStamp> findSaving(Connection& connection, std::uint64_t id,
                                    const RZAsset& content) {
  StatementUse statement(
      connection.prepared("SELECT size,inode,mtime,ctime FROM saving WHERE id=?1 AND hash=?2"));
  statement->bindID(1, id);
  statement->bindBytes(2, hashBytes(content));
  if (!statement->step()) return std::nullopt;
  FileStamp stamp;
  stamp.size = statement->id(0);
  stamp.inode = statement->id(1);
  stamp.mtime = statement->integer(2);
  stamp.ctime = statement->integer(3);
  return stamp;
}

void removeSavings(Connection& connection, std::uint64_t id) {
  StatementUse statement(connection.prepared("DELETE FROM saving WHERE id=?1"));
  statement->bindID(1, id);
  statement->step();
}

std::vector<std::uint64_t> findChildIDs(Connection& connection, std::uint64_t folder) {
  StatementUse statement(connection.prepared("SELECT id FROM item WHERE parent=?1"));
  statement->bindID(1, folder);
  std::vector<std::uint64_t> ids;
  while (statement->step()) ids.push_back(statement->id(0));
  return ids;
}

bool hasPins(Connection& connection) {
  StatementUse statement(connection.prepared("SELECT 1 FROM content WHERE pinned=1 LIMIT 1"));
  return statement->step();
}

bool isPinned(Connection& connection, std::uint64_t id) {
  if (!hasPins(connection)) return false;
  const auto chain = findChain(connection, id);
  if (!chain) return false;
  const auto isRowPinned = [&](std::uint64_t each) {
    const auto content = findContent(connection, each);
    return content && content->isPinned;
  };
  return std::any_of(chain->rows.begin(), chain->rows.end(),
                     [&](const ItemRow& row) { return isRowPinned(row.id); }) ||
         isRowPinned(chain->place);
}

RZRecordZoneID zoneOf(Connection& connection, std::uint64_t id, const RZRecordZoneID& before,
                      std::optional<std::int64_t> account) {
  const auto chain = findChain(connection, id);
  if (chain) {
    ZoneSource source = findZoneSource(connection, chain->rows, account);
    if (!source.zone.zoneName().empty()) return std::move(source.zone);
    const bool isKept = !before.zoneName().empty() && !isSharedZone(before);
    if (chain->place == kTrashID && isKept) return before;
  }
  return RZRecordZoneID(QSUbiquitousDefaultContainerID);
}

std::int64_t accountKey(Connection& connection, const std::string& account) {
  StatementUse insertion(connection.prepared("INSERT OR IGNORE INTO account(name) VALUES(?1)"));
  insertion->bindBytes(1, account);
  insertion->step();
  StatementUse statement(connection.prepared("SELECT key FROM account WHERE name=?1"));
  statement->bindBytes(1, account);
  return statement->step() ? statement->integer(0) : 0;
}

std::string accountName(Connection& connection, std::int64_t key) {
  StatementUse statement(connection.prepared("SELECT name FROM account WHERE key=?1"));
  statement->bindInteger(1, key);
  return statement->step() ? std::string(statement->bytes(0)) : std::string();
}

void claimForAccount(Connection& connection, std::int64_t key) {
  for (const char* sql : {"UPDATE job SET account=?1 WHERE account=0",
                          "UPDATE content SET account=?1 WHERE account=0"}) {
    Statement statement(connection.database(), sql);
    statement.bindInteger(1, key);
    statement.run();
  }
}

std::string encodeError(const NSErrorRef& error) {
  if (!error) return {};
  return error->domain() + '\n' + std::to_string(error->code()) + '\n' +
         error->localizedDescription();
}

NSErrorRef decodeError(std::string_view text) {
  const std::size_t first = text.find('\n');
  if (first == std::string_view::npos) return nullptr;
  const std::size_t second = text.find('\n', first + 1);
  if (second == std::string_view::npos) return nullptr;
  std::int64_t code = 0;
  std::from_chars(text.data() + first + 1, text.data() + second, code);
  return NSError::errorWithDomain(
      std::string(text.substr(0, first)), code,
      {{NSLocalizedDescriptionKey, std::string(text.substr(second + 1))}});
}

}  // namespace yomber
