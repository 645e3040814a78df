#include "platform/rozzel/records_schema.h"

#include <array>
#include <random>
#include <string>

#include "platform/foundation/fault_points.h"
#include "platform/rozzel/store_failure.h"

namespace yomber {

namespace {

constexpr std::int64_t kApplicationID = 0x525a7374;  // "RZst"

// Names, types and bodies are blobs: they need not be UTF-8. `charge` is what counts for the
// quota. `sequence` numbers a zone's changes; deletions up to `forgotten` have no tombstone any
// more. A dead zone is seen by nobody and waits to be cleared away.
constexpr const char* kVersion1 = R"sql(
  CREATE TABLE meta(key TEXT PRIMARY KEY, value INTEGER NOT NULL) WITHOUT ROWID;
  CREATE TABLE account(name BLOB PRIMARY KEY, quota INTEGER) WITHOUT ROWID;
  CREATE TABLE zone(
    id INTEGER PRIMARY KEY AUTOINCREMENT,
    container BLOB NOT NULL,
    owner BLOB NOT NULL,
    name BLOB NOT NULL,
    sequence INTEGER NOT NULL,
    forgotten INTEGER NOT NULL,
    tombstones INTEGER NOT NULL,
    charge INTEGER NOT NULL,
    dead INTEGER NOT NULL);
  CREATE UNIQUE INDEX zone_name ON zone(container, owner, name) WHERE dead=0;
  CREATE INDEX zone_owner ON zone(owner) WHERE dead=0;
  CREATE INDEX zone_dead ON zone(id) WHERE dead=1;
  CREATE TABLE record(
    id INTEGER PRIMARY KEY,
    zone INTEGER NOT NULL,
    name BLOB NOT NULL,
    type BLOB NOT NULL,
    sequence INTEGER NOT NULL,
    created INTEGER NOT NULL,
    modified INTEGER NOT NULL,
    charge INTEGER NOT NULL,
    body BLOB NOT NULL);
  CREATE UNIQUE INDEX record_name ON record(zone, name);
  CREATE UNIQUE INDEX record_change ON record(zone, sequence);
  CREATE INDEX record_type ON record(zone, type, name);
  CREATE TABLE tombstone(
    zone INTEGER NOT NULL,
    sequence INTEGER NOT NULL,
    name BLOB NOT NULL,
    type BLOB NOT NULL,
    PRIMARY KEY(zone, sequence)) WITHOUT ROWID;
  CREATE UNIQUE INDEX tombstone_name ON tombstone(zone, name);
  CREATE TABLE asset(
    hash BLOB PRIMARY KEY,
    size INTEGER NOT NULL,
    uses INTEGER NOT NULL,
    released INTEGER NOT NULL) WITHOUT ROWID;
  CREATE INDEX asset_released ON asset(released) WHERE uses=0;
)sql";

/// From 1 to 2: zones that other accounts see. Permission 0 is reading, 1 reading and writing.
constexpr const char* kMembers = R"sql(
  CREATE TABLE member(
    zone INTEGER NOT NULL,
    account BLOB NOT NULL,
    permission INTEGER NOT NULL,
    PRIMARY KEY(zone, account)) WITHOUT ROWID;
  CREATE INDEX member_account ON member(account);
)sql";

/// From 2 to 3: the tokens of shares' URLs, and which zones they lead to.
constexpr const char* kShares = R"sql(
  CREATE TABLE share(zone INTEGER PRIMARY KEY, token BLOB NOT NULL);
  CREATE UNIQUE INDEX share_token ON share(token);
)sql";

/// What leads from one version to the next. Never changed once it was in use; a new store goes
/// the same way.
constexpr std::array kMigrations = {kMembers, kShares};

constexpr std::int64_t kCurrentVersion = 1 + static_cast<std::int64_t>(kMigrations.size());

std::int64_t randomIdentity() {
  std::random_device device;
  const std::uint64_t high = device();
  return static_cast<std::int64_t>(((high << 32U) | device()) >> 1U);
}

void setVersion(RecordsConnection& connection, std::int64_t version) {
  connection.execute(("PRAGMA user_version=" + std::to_string(version)).c_str());
}

std::int64_t versionOf(RecordsConnection& connection) {
  return connection.integerOf("PRAGMA user_version");
}

/// One version further, unless another process was faster.
void migrateFrom(RecordsConnection& connection, std::int64_t version) {
  static FaultPoint beforeCommit("rozzel.migrate.before-commit");
  RecordsTransaction transaction(connection, RecordsTransaction::Kind::Write);
  if (versionOf(connection) != version) return;
  connection.execute(kMigrations.at(static_cast<std::size_t>(version - 1)));
  setVersion(connection, version + 1);
  if (beforeCommit.hit()) throwFailure(RZErrorStoreFull, "the migration was told to fail");
  transaction.commit();
}

void refuseWhatIsNotOurs(RecordsConnection& connection) {
  const std::int64_t version = versionOf(connection);
  if (version > kCurrentVersion) {
    throwFailure(RZErrorStoreTooNew, "the record store has version " + std::to_string(version) +
                                         ", this program knows versions up to " +
                                         std::to_string(kCurrentVersion) +
                                         "; use the program that made it, or a later one");
  }
  if (version < 1 || connection.integerOf("PRAGMA application_id") != kApplicationID) {
    throwFailure(RZErrorStoreDamaged,
                 "records.db is not the database of a record store; restore the store's folder "
                 "from a backup, or make a store in another folder");
  }
}

constexpr const char* kSettings =
    "PRAGMA synchronous=FULL; PRAGMA cache_size=-2048; PRAGMA temp_store=MEMORY;"
    "PRAGMA secure_delete=0; PRAGMA journal_size_limit=16777216;";

}  // namespace

std::int64_t recordsSchemaVersion() { return kCurrentVersion; }

void createRecordsSchema(RecordsConnection& connection) {
  const auto isEmpty = [&] {
    return versionOf(connection) == 0 &&
           connection.integerOf("SELECT count(*) FROM sqlite_master") == 0;
  };
  if (!isEmpty()) return;
  connection.execute("PRAGMA journal_mode=WAL; PRAGMA synchronous=FULL;");
  RecordsTransaction transaction(connection, RecordsTransaction::Kind::Write);
  if (!isEmpty()) return;
  connection.execute(kVersion1);
  connection.execute(("PRAGMA application_id=" + std::to_string(kApplicationID)).c_str());
  setVersion(connection, 1);
  RecordsQuery(connection.prepared("INSERT INTO meta VALUES('identity', ?1)"), randomIdentity())
      .run();
  transaction.commit();
}

void prepareRecordsSchema(RecordsConnection& connection) {
  connection.setWriteBackOnClose(false);
  refuseWhatIsNotOurs(connection);
  connection.setWriteBackOnClose(true);
  connection.execute(kSettings);
  while (true) {
    const std::int64_t version = versionOf(connection);
    if (version >= kCurrentVersion) break;
    migrateFrom(connection, version);
  }
  refuseWhatIsNotOurs(connection);
}

}  // namespace yomber
