#include "zarn/schema_migrations.h"

#include <gtest/gtest.h>

#include <map>
#include <string>

#include "platform/foundation/temporary_directory.h"
#include "zarn/connection.h"
#include "zarn/database.h"
#include "zarn/item_store.h"
#include "zarn/schema.h"
#include "zarn/tree_layout.h"
#include "zarn/write_transaction.h"

namespace yomber {
namespace {

/// A database as the first version of this program left it: a folder with a tagged document, and
/// one document that is gone.
constexpr const char* kVersionOne = R"sql(
  CREATE TABLE meta(key TEXT PRIMARY KEY, value) WITHOUT ROWID;
  INSERT INTO meta VALUES('identity',77),('rank',1700000000000009),('collation','153.120'),
    ('isComplete',1),('stampedUpTo',2);
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
  INSERT INTO item VALUES
    (1,0,-1,1,4,0,-5,5,10,5,16832,1700000000000001,X'',NULL,X'01'),
    (2,1,-1,1,6,0,-5,5,11,5,16832,1700000000000002,X'2E5472617368',NULL,X'02'),
    (3,5000,0,1,65540,0,-6,6,12,6,16832,1700000000000003,X'576F726B',NULL,X'03'),
    (4,5001,5000,0,196612,42,-7,7,13,7,33152,1700000000000004,X'6E6F7465',X'4E6F7465',X'04');
  CREATE TABLE extra(
    id INTEGER PRIMARY KEY,
    tags BLOB,
    favorite INTEGER,
    last_used INTEGER,
    container_id BLOB);
  INSERT INTO extra VALUES(5001,X'726564',3,NULL,NULL);
  CREATE INDEX extra_container ON extra(container_id) WHERE container_id IS NOT NULL;
  CREATE TABLE tombstone(
    rank INTEGER PRIMARY KEY,
    id INTEGER NOT NULL,
    kind INTEGER NOT NULL,
    parent INTEGER NOT NULL);
  INSERT INTO tombstone VALUES(1700000000000009,5002,0,5000);
  CREATE TABLE working(
    id INTEGER PRIMARY KEY,
    rank INTEGER NOT NULL,
    kind INTEGER NOT NULL,
    member INTEGER NOT NULL);
  INSERT INTO working VALUES(5001,1700000000000004,0,1);
  CREATE INDEX working_rank ON working(rank);
  CREATE INDEX working_departed ON working(rank) WHERE member=0;
  CREATE UNIQUE INDEX item_id ON item(id);
  CREATE INDEX item_inode ON item(inode);
  CREATE INDEX item_disk_name ON item(parent, disk_name) WHERE disk_name IS NOT NULL;
  CREATE UNIQUE INDEX item_name ON item(parent, name_key);
  CREATE INDEX item_date ON item(parent, age, name_key);
  CREATE INDEX folder_name ON item(name_key, id) WHERE kind=1 AND (flags & 2)=0 AND parent>=0;
  CREATE INDEX folder_date ON item(age, name_key, id) WHERE kind=1 AND (flags & 2)=0 AND parent>=0;
  PRAGMA application_id=2053206638;
  PRAGMA user_version=1;
)sql";

/// Every table and index with the text that made it.
std::map<std::string, std::string> tablesOf(Connection& connection) {
  std::map<std::string, std::string> result;
  Statement statement(connection.database(),
                      "SELECT CAST(name AS BLOB), CAST(sql AS BLOB) FROM sqlite_master");
  while (statement.step()) result.emplace(statement.bytes(0), statement.bytes(1));
  return result;
}

class SchemaMigrationsTest : public testing::Test {
 protected:
  SchemaMigrationsTest() : layout_(directory_.path()) {}
  void makeVersionOne() {
    Connection(layout_.databasePath(), Connection::Mode::Write).execute(kVersionOne);
  }

  TemporaryDirectory directory_;
  TreeLayout layout_;
};

TEST_F(SchemaMigrationsTest, ADatabaseOfTheFirstVersionKeepsAllItHolds) {
  makeVersionOne();
  NSErrorRef error;
  const auto database = Database::open(layout_.databasePath(), &error);
  ASSERT_NE(database, nullptr) << error->description();
  EXPECT_FALSE(database->needsFirstScan());
  EXPECT_EQ(database->identity(), 77U);
  EXPECT_EQ(database->currentRank(), 1700000000000009U);
  const ItemStore store(database, layout_);
  const auto folder = store.itemByName(kRootID, "Work");
  ASSERT_TRUE(folder);
  const auto document = store.itemByName(folder->id, "note");
  ASSERT_TRUE(document);
  EXPECT_EQ(document->id, 5001U);
  EXPECT_EQ(document->size, 42U);
  EXPECT_EQ(document->diskName, "Note");
  ASSERT_TRUE(document->extra);
  EXPECT_EQ(document->extra->tags, std::vector<std::string>{"red"});
}

TEST_F(SchemaMigrationsTest, AMigratedDatabaseHasTheTablesOfANewOne) {
  makeVersionOne();
  Connection migrated(layout_.databasePath(), Connection::Mode::Write);
  prepareSchema(migrated);
  Connection fresh(directory_.path() + "/fresh.db", Connection::Mode::Write);
  prepareSchema(fresh);
  EXPECT_EQ(tablesOf(migrated), tablesOf(fresh));
  EXPECT_EQ(migrated.integerOf("PRAGMA user_version"), kSchemaVersion);
}

TEST_F(SchemaMigrationsTest, AMigrationThatFailsLeavesTheOldVersion) {
  makeVersionOne();
  Connection connection(layout_.databasePath(), Connection::Mode::Write);
  connection.execute("CREATE TABLE content(something)");  // in the way
  EXPECT_ANY_THROW(prepareSchema(connection));
  EXPECT_EQ(connection.integerOf("PRAGMA user_version"), 1);
  EXPECT_EQ(tablesOf(connection).count("job"), 0U);
}

}  // namespace
}  // namespace yomber
