#include "zarn/schema_migrations.h"

#include <array>
#include <string>

#include "platform/foundation/log.h"

namespace yomber {

// One job of a kind for an item. A newer one replaces it with a row number of its own, so that
// whoever ends the older one leaves the newer alone. Whose file it is when nobody has ever been
// signed in: account 0.
// `content` is what the store is known to have, and of which file; a hash of null: nothing yet. Its
// row outlives the item until the store's record is gone too.
const char* const kContentTables = R"sql(
  CREATE TABLE account(key INTEGER PRIMARY KEY, name BLOB NOT NULL UNIQUE);
  CREATE TABLE job(
    seq INTEGER PRIMARY KEY,
    item INTEGER NOT NULL,
    kind INTEGER NOT NULL,
    account INTEGER NOT NULL,
    state INTEGER NOT NULL,
    attempts INTEGER NOT NULL,
    due INTEGER NOT NULL,
    created INTEGER NOT NULL,
    error BLOB);
  CREATE UNIQUE INDEX job_item ON job(item, kind);
  CREATE INDEX job_due ON job(account, kind, due, seq);
  CREATE TABLE content(
    id INTEGER PRIMARY KEY,
    account INTEGER NOT NULL,
    pinned INTEGER NOT NULL,
    zone BLOB,
    parent INTEGER,
    name BLOB,
    hash BLOB,
    tag BLOB,
    size INTEGER,
    inode INTEGER,
    mtime INTEGER,
    ctime INTEGER);
  CREATE INDEX content_pinned ON content(id) WHERE pinned=1;
)sql";

// Those that have failed are shown again and again, however many wait.
const char* const kFailedJobsIndex =
    "CREATE INDEX job_failed ON job(account, due, seq) WHERE state<>0";

// What was drawn of some content; a hash of null: nothing can be. `version`: of what drew.
const char* const kThumbnailTable =
    "CREATE TABLE thumbnail(content BLOB PRIMARY KEY, version INTEGER NOT NULL, hash BLOB, "
    "size INTEGER NOT NULL) WITHOUT ROWID";

// `owner` of content is null where the zone is a container's. `share` has a row for each item of
// the drive that is shared, its own or somebody else's.
const char* const kShareTables = R"sql(
  ALTER TABLE content ADD COLUMN owner BLOB;
  CREATE INDEX content_shared ON content(zone, owner) WHERE owner IS NOT NULL;
  CREATE TABLE share(
    root INTEGER PRIMARY KEY,
    account INTEGER NOT NULL,
    zone BLOB NOT NULL,
    owner BLOB NOT NULL,
    state INTEGER NOT NULL,
    writable INTEGER NOT NULL,
    folder INTEGER NOT NULL,
    title BLOB NOT NULL,
    token BLOB NOT NULL,
    zone_tag BLOB NOT NULL);
  CREATE UNIQUE INDEX share_zone ON share(account, zone, owner);
  CREATE TABLE share_waiting(
    root INTEGER NOT NULL,
    record INTEGER NOT NULL,
    PRIMARY KEY(root, record)) WITHOUT ROWID;
)sql";

// When records that wait are asked for again: ns since the epoch.
const char* const kShareWaitingTimes = R"sql(
  ALTER TABLE share_waiting ADD COLUMN attempts INTEGER NOT NULL DEFAULT 0;
  ALTER TABLE share_waiting ADD COLUMN due INTEGER NOT NULL DEFAULT 0;
  CREATE INDEX share_waiting_due ON share_waiting(root, due);
)sql";

// What the store was about to be given as a shared document's content, and of which file; until one
// of them is known to be there.
const char* const kSavingTable =
    "CREATE TABLE saving(id INTEGER NOT NULL, hash BLOB NOT NULL, size INTEGER NOT NULL, "
    "inode INTEGER NOT NULL, mtime INTEGER NOT NULL, ctime INTEGER NOT NULL, "
    "PRIMARY KEY(id, hash)) WITHOUT ROWID";

namespace {

/// What turns version n, its place in the table plus one, into the next. Never changed once
/// released: files of every earlier version come by here.
struct Migration {
  const char* purpose;
  void (*run)(Connection&);
};

constexpr std::array kMigrations{
    Migration{"jobs and content",
              [](Connection& connection) { connection.execute(kContentTables); }},
    Migration{"an index of jobs that failed",
              [](Connection& connection) { connection.execute(kFailedJobsIndex); }},
    Migration{"thumbnails", [](Connection& connection) { connection.execute(kThumbnailTable); }},
    Migration{"shares", [](Connection& connection) { connection.execute(kShareTables); }},
    Migration{"when shared records are asked for again",
              [](Connection& connection) { connection.execute(kShareWaitingTimes); }},
    Migration{"what is being saved in shares",
              [](Connection& connection) { connection.execute(kSavingTable); }},
};

}  // namespace

void migrateSchema(Connection& connection, std::int64_t from, std::int64_t to) {
  for (std::int64_t version = from; version < to; ++version) {
    const Migration& migration = kMigrations.at(static_cast<std::size_t>(version - 1));
    log_default(defaultLog(), "[NOTICE] the database goes from version %lld to %lld: %@", version,
                version + 1, migration.purpose);
    migration.run(connection);
    connection.execute(("PRAGMA user_version=" + std::to_string(version + 1)).c_str());
  }
}

}  // namespace yomber
