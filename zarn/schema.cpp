#include "zarn/schema.h"

#include <SQLiteCpp/Exception.h>
#include <SQLiteCpp/Transaction.h>

#include <chrono>

#include "platform/foundation/log.h"
#include "zarn/name_collation.h"
#include "zarn/random_id.h"
#include "zarn/schema_migrations.h"

namespace yomber {
namespace {

constexpr std::int64_t kApplicationID = 0x7a61726e;  // "zarn"

// Rows of a folder that come in one scan are stored in name order, so that a page by name reads
// neighbouring rows. `age` is the modification time negated: both orders then run forwards. Names
// are blobs: they need not be UTF-8.
constexpr const char* kTables = R"sql(
  CREATE TABLE meta(key TEXT PRIMARY KEY, value) WITHOUT ROWID;
  CREATE TABLE item(
    seq INTEGER PRIMARY KEY,
    id INTEGER NOT NULL,
    parent INTEGER NOT NULL,
    kind INTEGER NOT NULL,
    flags INTEGER NOT NULL,
    size INTEGER NOT NULL,
    age INTEGER NOT NULL,
    btime INTEGER NOT NULL,
    inode INTEGER NOT NULL,
    ctime INTEGER NOT NULL,
    mode INTEGER NOT NULL,
    rank INTEGER NOT NULL,
    name BLOB NOT NULL,
    disk_name BLOB,
    name_key BLOB NOT NULL);
  CREATE TABLE extra(
    id INTEGER PRIMARY KEY,
    tags BLOB,
    favorite INTEGER,
    last_used INTEGER,
    container_id BLOB);
  CREATE INDEX extra_container ON extra(container_id) WHERE container_id IS NOT NULL;
  CREATE TABLE tombstone(
    rank INTEGER PRIMARY KEY,
    id INTEGER NOT NULL,
    kind INTEGER NOT NULL,
    parent INTEGER NOT NULL);
  CREATE TABLE working(
    id INTEGER PRIMARY KEY,
    rank INTEGER NOT NULL,
    kind INTEGER NOT NULL,
    member INTEGER NOT NULL);
  CREATE INDEX working_rank ON working(rank);
  CREATE INDEX working_departed ON working(rank) WHERE member=0;
)sql";

constexpr const char* kIndexes = R"sql(
  CREATE UNIQUE INDEX item_id ON item(id);
  CREATE INDEX item_inode ON item(inode);
  CREATE INDEX item_disk_name ON item(parent, disk_name) WHERE disk_name IS NOT NULL;
)sql";

constexpr const char* kKeyIndexes = R"sql(
  CREATE UNIQUE INDEX item_name ON item(parent, name_key);
  CREATE INDEX item_date ON item(parent, age, name_key);
  CREATE INDEX folder_name ON item(name_key, id) WHERE kind=1 AND (flags & 2)=0 AND parent>=0;
  CREATE INDEX folder_date ON item(age, name_key, id) WHERE kind=1 AND (flags & 2)=0 AND parent>=0;
)sql";

constexpr const char* kDropKeyIndexes =
    "DROP INDEX item_name; DROP INDEX item_date; DROP INDEX folder_name; DROP INDEX folder_date;";

std::string metaText(Connection& connection, const char* key) {
  Statement statement(connection.database(), "SELECT value FROM meta WHERE key=CAST(?1 AS TEXT)");
  statement.bindBytes(1, key);
  return statement.step() ? std::string(statement.bytes(0)) : std::string();
}

void setMetaText(Connection& connection, const char* key, const std::string& value) {
  Statement statement(connection.database(),
                      "INSERT OR REPLACE INTO meta VALUES(CAST(?1 AS TEXT), CAST(?2 AS TEXT))");
  statement.bindBytes(1, key);
  statement.bindBytes(2, value);
  statement.run();
}

constexpr const char* kCollation = "collation";

void rebuildSortKeys(Connection& connection) {
  log_default(defaultLog(), "[NOTICE] sort keys are made anew for collation %@",
              nameCollationVersion());
  connection.execute(kDropKeyIndexes);
  Statement rows(connection.database(), "SELECT seq, name FROM item");
  Statement update(connection.database(), "UPDATE item SET name_key=?1 WHERE seq=?2");
  while (rows.step()) {
    const std::string key = nameSortKey(rows.bytes(1));
    update.bindBytes(1, key);
    update.bindInteger(2, rows.integer(0));
    update.run();
  }
  rows.reset();
  connection.execute(kKeyIndexes);
  setMetaText(connection, kCollation, nameCollationVersion());
}

}  // namespace

void createTables(Connection& connection) {
  connection.execute(kTables);
  connection.execute(kContentTables);
  connection.execute(kFailedJobsIndex);
  connection.execute(kThumbnailTable);
  connection.execute(kShareTables);
  connection.execute(kShareWaitingTimes);
  connection.execute(kSavingTable);
  connection.execute(("PRAGMA application_id=" + std::to_string(kApplicationID)).c_str());
  connection.execute(("PRAGMA user_version=" + std::to_string(kSchemaVersion)).c_str());
  setMetaInteger(connection, meta::kIdentity, static_cast<std::int64_t>(randomID()));
  setMetaInteger(connection, meta::kRank, static_cast<std::int64_t>(initialRank()));
  setMetaText(connection, kCollation, nameCollationVersion());
}

void createIndexes(Connection& connection) {
  connection.execute(kIndexes);
  connection.execute(kKeyIndexes);
}

void prepareSchema(Connection& connection) {
  SQLite::Transaction transaction(connection.database());
  const std::int64_t version = connection.integerOf("PRAGMA user_version");
  if (version > kSchemaVersion) throw SchemaTooNew{version};
  if (version == 0) {
    createTables(connection);
    createIndexes(connection);
  } else {
    migrateSchema(connection, version, kSchemaVersion);
    if (metaText(connection, kCollation) != nameCollationVersion()) rebuildSortKeys(connection);
  }
  transaction.commit();
}

std::int64_t metaInteger(Connection& connection, const char* key) {
  Statement statement(connection.database(), "SELECT value FROM meta WHERE key=CAST(?1 AS TEXT)");
  statement.bindBytes(1, key);
  return statement.step() ? statement.integer(0) : 0;
}

void setMetaInteger(Connection& connection, const char* key, std::int64_t value) {
  StatementUse statement(
      connection.prepared("INSERT OR REPLACE INTO meta VALUES(CAST(?1 AS TEXT), ?2)"));
  statement->bindBytes(1, key);
  statement->bindInteger(2, value);
  statement->step();
}

std::uint64_t initialRank() {
  const auto now = std::chrono::system_clock::now().time_since_epoch();
  return static_cast<std::uint64_t>(
      std::chrono::duration_cast<std::chrono::microseconds>(now).count());
}

}  // namespace yomber
