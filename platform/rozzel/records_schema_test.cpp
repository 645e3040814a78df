#include "platform/rozzel/records_schema.h"

#include <gtest/gtest.h>
#include <signal.h>

#include <charconv>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <map>
#include <string>
#include <string_view>
#include <vector>

#include "platform/foundation/fault_points.h"
#include "platform/rozzel/records_connection.h"
#include "platform/rozzel/test_store.h"
#include "platform/rozzel/version1_store.h"

namespace yomber {
namespace {

std::string databaseOf(const TestStore& store) { return store.folder() + "/records.db"; }

void removeDatabase(const TestStore& store) {
  for (const char* const suffix : {"", "-wal", "-shm"}) {
    std::filesystem::remove(databaseOf(store) + suffix);
  }
}

void runSql(const std::string& database, const char* sql) {
  RecordsConnection connection(database, RecordsConnection::Missing::Create, 1000);
  connection.execute(sql);
}

std::int64_t versionOf(const std::string& database) {
  RecordsConnection connection(database, RecordsConnection::Missing::Fail, 1000);
  return connection.integerOf("PRAGMA user_version");
}

/// A store whose database is one of version 1.
struct OldStore : TestStore {
  OldStore() {
    close();
    removeDatabase(*this);
    runSql(databaseOf(*this), kVersion1Store);
    EXPECT_EQ(versionOf(databaseOf(*this)), 1);
    reopen();
  }
};

std::string bytesOfHex(std::string_view hex) {
  std::string bytes;
  for (std::size_t index = 0; index < hex.size(); index += 2) {
    unsigned byte = 0;
    std::from_chars(hex.data() + index, hex.data() + index + 2, byte, 16);
    bytes += static_cast<char>(byte);
  }
  return bytes;
}

std::string fileBytes(const std::string& path) {
  std::ifstream file(path, std::ios::binary);
  return {std::istreambuf_iterator<char>(file), {}};
}

/// Tables and indexes by name, as the database knows them.
std::map<std::string, std::string> schemaOf(const std::string& database) {
  RecordsConnection connection(database, RecordsConnection::Missing::Fail, 1000);
  std::map<std::string, std::string> schema;
  RecordsQuery query(connection.prepared("SELECT name, sql FROM sqlite_master"));
  while (query.step()) schema.emplace(query->bytes(0), query->bytes(1));
  return schema;
}

TEST(RecordsSchemaTest, GivesANewStoreTheCurrentVersion) {
  TestStore store;
  EXPECT_EQ(versionOf(databaseOf(store)), recordsSchemaVersion());
}

TEST(RecordsSchemaTest, BringsAStoreOfVersion1UpToDateWithAllThatIsInIt) {
  OldStore store;
  const RZAsset content = storeText(*store.engine(), kVersion1Content);
  const auto record = fetch(store.database(), "report");
  ASSERT_NE(record, nullptr);
  EXPECT_EQ(versionOf(databaseOf(store)), recordsSchemaVersion());
  EXPECT_EQ(record->values(), (RZValues{{"name", "report.pdf"},
                                        {"bytes", RZBytes{std::string("\0\xff", 2)}},
                                        {"number", std::int64_t{-5}},
                                        {"ratio", 2.5},
                                        {"date", NSDate::fromNanoseconds(1700000000123456789)},
                                        {"tags", std::vector<std::string>{"red", "green"}},
                                        {"parent", RZReference{recordID("root")}},
                                        {"content", content}}));
  EXPECT_EQ(record->creationDate(), NSDate::fromNanoseconds(1760000000000000001));
  EXPECT_EQ(fetch(store.database(), "root")->recordType(), "folder");
  RZQuota quota;
  ASSERT_EQ(store.engine()->fetchQuota("ann", quota), nullptr);
  EXPECT_EQ(quota.limit, 1'000'000U);
  EXPECT_EQ(quota.used, 225U);
  std::vector<RZRecordZone> zones;
  ASSERT_EQ(store.database()->fetchZones(zones), nullptr);
  EXPECT_EQ(zones.size(), 2U);
  EXPECT_EQ(change(store.database(), "report", "name", "renamed.pdf"), nullptr);
}

TEST(RecordsSchemaTest, LetsReadersOfVersion1GoOnWithTheirTokens) {
  OldStore store;
  RZChangePage page;
  const std::string token = bytesOfHex(kVersion1Token);
  ASSERT_EQ(store.database()->fetchChanges(kZone, token, 10, {}, page), nullptr);
  EXPECT_TRUE(page.changes.empty());
  ASSERT_EQ(save(store.database(), {newRecord("new")}), nullptr);
  ASSERT_EQ(store.database()->fetchChanges(kZone, token, 10, {}, page), nullptr);
  ASSERT_EQ(page.changes.size(), 1U);
  EXPECT_EQ(page.changes[0].recordID, recordID("new"));
}

TEST(RecordsSchemaTest, AddsMembersToAStoreOfVersion1) {
  OldStore store;
  ASSERT_EQ(store.engine()->addMember(store.database()->databaseID(), kZone, {"bob"}), nullptr);
  EXPECT_NE(fetch(store.sharedDatabase("bob"), "root", RZRecordZoneID("documents", "ann")),
            nullptr);
}

TEST(RecordsSchemaTest, AddsSharesToAStoreOfVersion2AndKeepsItsMembers) {
  OldStore store;
  store.close();
  runSql(databaseOf(store), kVersion2Additions);
  ASSERT_EQ(versionOf(databaseOf(store)), 2);
  store.reopen();
  const RZRecordZoneID asBobSeesIt("documents", "ann");
  EXPECT_NE(fetch(store.sharedDatabase("bob"), "root", asBobSeesIt), nullptr);
  EXPECT_EQ(versionOf(databaseOf(store)), recordsSchemaVersion());
  const RZRecordZoneID zone("pictures");
  const RZShare share(recordID("root", zone), RZShareTypeFolder, "Pictures", "ann");
  RZShareRef saved;
  ASSERT_EQ(store.database()->saveShare(share, saved), nullptr);
  EXPECT_TRUE(saved->URL());
  EXPECT_NE(fetch(store.sharedDatabase("bob"), "root", asBobSeesIt), nullptr);
}

TEST(RecordsSchemaTest, GivesMigratedAndNewStoresTheSameTables) {
  OldStore old;
  TestStore fresh;
  ASSERT_NE(fetch(old.database(), "report"), nullptr);
  EXPECT_EQ(schemaOf(databaseOf(old)), schemaOf(databaseOf(fresh)));
}

TEST(RecordsSchemaTest, LosesNothingWhenKilledWhileMigrating) {
  OldStore store;
  store.close();
  const int status = inAnotherProcess([&] {
    store.reopen();
    if (FaultPoint::arm("rozzel.migrate.before-commit=abort")) return 2;
    return fetch(store.database(), "report") ? 0 : 3;
  });
  ASSERT_EQ(status, 128 + SIGABRT);
  EXPECT_EQ(versionOf(databaseOf(store)), 1);
  store.reopen();
  EXPECT_NE(fetch(store.database(), "report"), nullptr);
  EXPECT_EQ(versionOf(databaseOf(store)), recordsSchemaVersion());
}

TEST(RecordsSchemaTest, LetsSeveralProcessesMigrateAtOnce) {
  OldStore store;
  store.close();
  std::vector<pid_t> children;
  for (int index = 0; index < 4; ++index) {
    children.push_back(startProcess([&] {
      store.reopen();
      return fetch(store.database(), "report") ? 0 : 1;
    }));
  }
  for (const pid_t child : children) EXPECT_EQ(waitForProcess(child), 0);
  EXPECT_EQ(versionOf(databaseOf(store)), recordsSchemaVersion());
}

TEST(RecordsSchemaTest, RefusesAStoreOfALaterVersionAndLeavesItAlone) {
  TestStore store;
  ASSERT_EQ(save(store.database(), {newRecord("a")}), nullptr);
  store.close();
  {
    // As a kill would leave it: the last change is in the log alone.
    RecordsConnection later(databaseOf(store), RecordsConnection::Missing::Fail, 1000);
    later.setWriteBackOnClose(false);
    later.execute("PRAGMA user_version=99");
  }
  const std::string before = fileBytes(databaseOf(store));
  const std::string logBefore = fileBytes(databaseOf(store) + "-wal");
  ASSERT_FALSE(logBefore.empty());
  store.reopen();
  NSErrorRef error;
  EXPECT_EQ(store.database()->fetchRecord(recordID("a"), &error), nullptr);
  EXPECT_TRUE(rz_isError(error, RZErrorStoreTooNew));
  EXPECT_NE(error->localizedDescription().find("99"), std::string::npos);
  EXPECT_TRUE(rz_isError(save(store.database(), {newRecord("b")}), RZErrorStoreTooNew));
  EXPECT_TRUE(rz_isError(EmbeddedEngine::create(store.folder()), RZErrorStoreTooNew));
  store.close();
  EXPECT_EQ(fileBytes(databaseOf(store)), before);
  EXPECT_EQ(fileBytes(databaseOf(store) + "-wal"), logBefore);
  EXPECT_EQ(versionOf(databaseOf(store)), 99);
}

TEST(RecordsSchemaTest, RefusesADatabaseThatIsNoRecordStore) {
  TestStore store;
  store.close();
  const auto isRefused = [&] {
    store.reopen();
    const bool refused = rz_isError(save(store.database(), {newRecord("a")}), RZErrorStoreDamaged);
    store.close();
    removeDatabase(store);
    return refused;
  };
  removeDatabase(store);
  newFile(databaseOf(store));
  EXPECT_TRUE(isRefused()) << "an empty file";
  std::ofstream(databaseOf(store)) << std::string(10'000, 'x');
  EXPECT_TRUE(isRefused()) << "a file of something else";
  runSql(databaseOf(store), "CREATE TABLE other(x); PRAGMA user_version=1;");
  const std::string before = fileBytes(databaseOf(store));
  EXPECT_TRUE(rz_isError(EmbeddedEngine::create(store.folder()), RZErrorStoreDamaged));
  EXPECT_EQ(fileBytes(databaseOf(store)), before);
  EXPECT_TRUE(isRefused()) << "a database of another program";
}

TEST(RecordsSchemaTest, FinishesAStoreWhoseMakingWasCutShort) {
  TestStore store;
  store.close();
  removeDatabase(store);
  newFile(databaseOf(store));
  std::filesystem::remove_all(store.folder() + "/assets");
  ASSERT_EQ(EmbeddedEngine::create(store.folder()), nullptr);
  store.reopen();
  EXPECT_EQ(store.database()->createZone(kZone), nullptr);
  storeText(*store.engine(), "content");
}

}  // namespace
}  // namespace yomber
