#include <gtest/gtest.h>

#include <algorithm>
#include <memory>
#include <set>
#include <string>
#include <vector>

#include "platform/rozzel/records_connection.h"
#include "platform/rozzel/test_store.h"

namespace yomber {
namespace {

TEST(RecordStoreTest, GivesARecordBackAsItWasSaved) {
  TestStore store;
  const RZAsset asset = storeText(*store.engine(), "content");
  const RZValues values = {{"text", "a"},
                           {"empty", ""},
                           {"bytes", RZBytes{std::string("\0\xff", 2)}},
                           {"integer", std::int64_t{-1}},
                           {"real", 0.5},
                           {"date", NSDate::fromNanoseconds(-1)},
                           {"texts", std::vector<std::string>{"", "b"}},
                           {"reference", RZReference{recordID("other")}},
                           {"asset", asset}};
  ASSERT_EQ(save(store.database(), {newRecord("a", values)}), nullptr);
  store.reopen();
  const auto record = fetch(store.database(), "a");
  ASSERT_NE(record, nullptr);
  EXPECT_EQ(record->values(), values);
  EXPECT_EQ(record->recordType(), "document");
  EXPECT_FALSE(record->changeTag().empty());
  EXPECT_TRUE(record->creationDate());
  EXPECT_TRUE(record->changedKeys().empty());
}

TEST(RecordStoreTest, AnswersEachIdOfAFetchInOrder) {
  TestStore store;
  ASSERT_EQ(save(store.database(), {newRecord("b"), newRecord("a")}), nullptr);
  std::vector<RZFetchedRecord> records;
  const RZRecordZoneID elsewhere("elsewhere");
  ASSERT_EQ(store.database()->fetchRecords(
                {recordID("a"), recordID("missing"), recordID("b"), recordID("a", elsewhere)}, {},
                records),
            nullptr);
  ASSERT_EQ(records.size(), 4U);
  EXPECT_EQ(records[0].record->recordID(), recordID("a"));
  EXPECT_TRUE(rz_isError(records[1].error, RZErrorUnknownItem));
  EXPECT_EQ(records[2].record->recordID(), recordID("b"));
  EXPECT_TRUE(rz_isError(records[3].error, RZErrorZoneNotFound));
}

TEST(RecordStoreTest, BringsOnlyTheDesiredKeys) {
  TestStore store;
  ASSERT_EQ(save(store.database(), {newRecord("a", {{"x", 1}, {"y", 2}})}), nullptr);
  std::vector<RZFetchedRecord> records;
  ASSERT_EQ(store.database()->fetchRecords(
                {recordID("a")}, RZDesiredKeys{{std::string("y"), std::string("z")}}, records),
            nullptr);
  EXPECT_EQ(records[0].record->values(), (RZValues{{"y", 2}}));
}

TEST(RecordStoreTest, SavesAllOfABatchOrNothing) {
  TestStore store;
  const auto database = store.database();
  ASSERT_EQ(save(database, {newRecord("a", {{"x", 1}}), newRecord("gone")}), nullptr);
  auto changed = std::make_shared<RZRecord>(*fetch(database, "a"));
  changed->setObject(2, "x");
  std::vector<RZRecordRef> saved;
  // The record "gone" exists, so a new one of that name is refused.
  const NSErrorRef error =
      database->modifyRecords({.recordsToSave = {newRecord("new"), changed, newRecord("gone")},
                               .recordsToDelete = {{.recordID = recordID("a2")}}},
                              saved);
  ASSERT_TRUE(rz_isError(error, RZErrorServerRecordChanged));
  ASSERT_EQ(rz_failedRecords(error).size(), 1U);
  EXPECT_EQ(rz_failedRecords(error)[0].first, recordID("gone"));
  EXPECT_TRUE(saved.empty());
  EXPECT_EQ(fetch(database, "new"), nullptr);
  EXPECT_EQ(*fetch(database, "a")->valueForKey<std::int64_t>("x"), 1);
}

TEST(RecordStoreTest, RefusesASaveOfARecordThatAnotherChanged) {
  TestStore store;
  const auto database = store.database();
  ASSERT_EQ(save(database, {newRecord("a", {{"x", 1}})}), nullptr);
  auto mine = std::make_shared<RZRecord>(*fetch(database, "a"));
  ASSERT_EQ(change(database, "a", "x", 2), nullptr);
  mine->setObject(3, "x");
  const NSErrorRef error = save(database, {mine});
  ASSERT_TRUE(rz_isError(error, RZErrorServerRecordChanged));
  ASSERT_NE(rz_serverRecord(error), nullptr);
  EXPECT_EQ(*rz_serverRecord(error)->valueForKey<std::int64_t>("x"), 2);
  auto again = std::make_shared<RZRecord>(*rz_serverRecord(error));
  again->setObject(3, "x");
  EXPECT_EQ(save(database, {again}), nullptr);
}

TEST(RecordStoreTest, RefusesASaveOfARecordThatAnotherDeleted) {
  TestStore store;
  const auto database = store.database();
  ASSERT_EQ(save(database, {newRecord("a")}), nullptr);
  const auto mine = std::make_shared<RZRecord>(*fetch(database, "a"));
  ASSERT_EQ(remove(database, recordID("a")), nullptr);
  EXPECT_TRUE(rz_isError(save(database, {mine}), RZErrorUnknownItem));
  // And under a tag of before, when it was made anew.
  ASSERT_EQ(save(database, {newRecord("a")}), nullptr);
  EXPECT_TRUE(rz_isError(save(database, {mine}), RZErrorServerRecordChanged));
}

TEST(RecordStoreTest, GivesEverySaveATagOfItsOwn) {
  TestStore store;
  const auto database = store.database();
  std::set<std::string> tags;
  ASSERT_EQ(save(database, {newRecord("a"), newRecord("b")}), nullptr);
  tags.insert(fetch(database, "a")->changeTag());
  tags.insert(fetch(database, "b")->changeTag());
  for (int round = 0; round < 3; ++round) {
    ASSERT_EQ(change(database, "a", "x", round), nullptr);
    tags.insert(fetch(database, "a")->changeTag());
  }
  ASSERT_EQ(database->deleteZone(kZone), nullptr);
  ASSERT_EQ(database->createZone(kZone), nullptr);
  ASSERT_EQ(save(database, {newRecord("a")}), nullptr);
  tags.insert(fetch(database, "a")->changeTag());
  EXPECT_EQ(tags.size(), 6U);
}

TEST(RecordStoreTest, WritesChangedKeysOverWhateverIsThere) {
  TestStore store;
  const auto database = store.database();
  ASSERT_EQ(save(database, {newRecord("a", {{"x", 1}, {"y", 1}, {"z", 1}})}), nullptr);
  auto mine = std::make_shared<RZRecord>(*fetch(database, "a"));
  ASSERT_EQ(change(database, "a", "y", 2), nullptr);
  mine->setObject(3, "x");
  mine->removeObjectForKey("z");
  ASSERT_EQ(save(database, {mine}, RZRecordSavePolicy::ChangedKeys), nullptr);
  EXPECT_EQ(fetch(database, "a")->values(), (RZValues{{"x", 3}, {"y", 2}}));
}

TEST(RecordStoreTest, WritesAllKeysOverWhateverIsThere) {
  TestStore store;
  const auto database = store.database();
  ASSERT_EQ(save(database, {newRecord("a", {{"x", 1}, {"y", 1}})}), nullptr);
  const auto mine = std::make_shared<RZRecord>(*fetch(database, "a"));
  ASSERT_EQ(change(database, "a", "y", 2), nullptr);
  ASSERT_EQ(change(database, "a", "other", 2), nullptr);
  ASSERT_EQ(save(database, {mine}, RZRecordSavePolicy::AllKeys), nullptr);
  EXPECT_EQ(fetch(database, "a")->values(), (RZValues{{"other", 2}, {"x", 1}, {"y", 1}}));
}

TEST(RecordStoreTest, LosesNoKeysWhenAPartOfARecordIsSaved) {
  TestStore store;
  const auto database = store.database();
  ASSERT_EQ(save(database, {newRecord("a", {{"x", 1}, {"y", 1}})}), nullptr);
  for (const auto policy :
       {RZRecordSavePolicy::IfServerRecordUnchanged, RZRecordSavePolicy::AllKeys}) {
    std::vector<RZFetchedRecord> records;
    ASSERT_EQ(database->fetchRecords({recordID("a")}, RZDesiredKeys{{std::string("x")}}, records),
              nullptr);
    auto part = std::make_shared<RZRecord>(*records[0].record);
    part->setObject(2, "x");
    ASSERT_EQ(save(database, {part}, policy), nullptr);
    EXPECT_EQ(fetch(database, "a")->values(), (RZValues{{"x", 2}, {"y", 1}}));
  }
}

TEST(RecordStoreTest, KeepsTheDateOfCreationAndMovesThatOfModification) {
  std::int64_t time = 1000;
  TestStore store({.clock = [&] { return NSDate::fromNanoseconds(time); }});
  ASSERT_EQ(save(store.database(), {newRecord("a")}), nullptr);
  time = 2000;
  ASSERT_EQ(change(store.database(), "a", "x", 1), nullptr);
  const auto record = fetch(store.database(), "a");
  EXPECT_EQ(record->creationDate(), NSDate::fromNanoseconds(1000));
  EXPECT_EQ(record->modificationDate(), NSDate::fromNanoseconds(2000));
}

TEST(RecordStoreTest, LetsADeletionBeRepeated) {
  TestStore store;
  ASSERT_EQ(save(store.database(), {newRecord("a")}), nullptr);
  EXPECT_EQ(remove(store.database(), recordID("a")), nullptr);
  EXPECT_EQ(remove(store.database(), recordID("a")), nullptr);
}

TEST(RecordStoreTest, RefusesADeletionUnderAnOldTag) {
  TestStore store;
  const auto database = store.database();
  ASSERT_EQ(save(database, {newRecord("a")}), nullptr);
  const std::string tag = fetch(database, "a")->changeTag();
  ASSERT_EQ(change(database, "a", "x", 1), nullptr);
  std::vector<RZRecordRef> saved;
  const RZRecordBatch batch{.recordsToDelete = {{.recordID = recordID("a"), .changeTag = tag}}};
  EXPECT_TRUE(rz_isError(database->modifyRecords(batch, saved), RZErrorServerRecordChanged));
  EXPECT_NE(fetch(database, "a"), nullptr);
}

TEST(RecordStoreTest, RefusesBatchesThatMakeNoSense) {
  TestStore store;
  const auto database = store.database();
  EXPECT_TRUE(
      rz_isError(save(database, {newRecord("a"), newRecord("a")}), RZErrorInvalidArguments));
  const RZRecordZoneID ownName("documents", "ann");  // the same zone under its owner's name
  EXPECT_TRUE(rz_isError(save(database, {newRecord("a"), newRecord("a", {}, ownName)}),
                         RZErrorInvalidArguments));
  EXPECT_TRUE(rz_isError(save(database, {nullptr}), RZErrorInvalidArguments));
  EXPECT_TRUE(rz_isError(save(database, {newRecord("")}), RZErrorInvalidArguments));
  EXPECT_TRUE(rz_isError(save(database, {newRecord("a", {}, RZRecordZoneID("none"))}),
                         RZErrorZoneNotFound));
  EXPECT_TRUE(rz_isError(save(database, {newRecord("a", {}, RZRecordZoneID("documents", "bob"))}),
                         RZErrorInvalidArguments));
}

TEST(RecordStoreTest, RefusesARecordUnderAnotherType) {
  TestStore store;
  ASSERT_EQ(save(store.database(), {newRecord("a")}), nullptr);
  const auto other = std::make_shared<RZRecord>("folder", recordID("a"));
  EXPECT_TRUE(rz_isError(save(store.database(), {other}, RZRecordSavePolicy::AllKeys),
                         RZErrorInvalidArguments));
}

TEST(RecordStoreTest, RefusesWhatIsTooLarge) {
  TestStore store;
  const auto database = store.database();
  const std::string large(RZMaximumRecordBytes, 'x');
  EXPECT_TRUE(rz_isError(save(database, {newRecord("a", {{"x", large}})}), RZErrorLimitExceeded));
  ASSERT_EQ(save(database, {newRecord("a", {{"x", large.substr(large.size() / 2)}})}), nullptr);
  // Two halves that only together are too much.
  EXPECT_TRUE(
      rz_isError(change(database, "a", "y", large.substr(large.size() / 2)), RZErrorLimitExceeded));
  EXPECT_TRUE(rz_isError(save(database, {newRecord(std::string(256, 'n'))}), RZErrorLimitExceeded));
  EXPECT_EQ(save(database, {newRecord(std::string(255, 'n'))}), nullptr);
  std::vector<RZRecordRef> many;
  for (std::size_t index = 0; index <= RZMaximumBatchRecords; ++index) {
    many.push_back(newRecord("r" + std::to_string(index)));
  }
  EXPECT_TRUE(rz_isError(save(database, many), RZErrorLimitExceeded));
  many.pop_back();
  EXPECT_EQ(save(database, many), nullptr);
}

TEST(RecordStoreTest, KeepsAccountsAndContainersApart) {
  TestStore store;
  ASSERT_EQ(save(store.database("ann"), {newRecord("a")}), nullptr);
  EXPECT_EQ(fetch(store.database("bob"), "a"), nullptr);
  ASSERT_EQ(store.database("bob")->createZone(kZone), nullptr);
  EXPECT_EQ(fetch(store.database("bob"), "a"), nullptr);
  const RZContainer other(store.engine(), "com.example.other", "ann");
  std::vector<RZRecordZone> zones;
  ASSERT_EQ(other.privateCloudDatabase()->fetchZones(zones), nullptr);
  EXPECT_TRUE(zones.empty());
}

TEST(RecordStoreTest, MakesAndDeletesZonesRepeatably) {
  TestStore store;
  const auto database = store.database();
  const RZRecordZoneID pictures("pictures");
  EXPECT_EQ(database->createZone(pictures), nullptr);
  EXPECT_EQ(database->createZone(pictures), nullptr);
  std::vector<RZRecordZone> zones;
  ASSERT_EQ(database->fetchZones(zones), nullptr);
  ASSERT_EQ(zones.size(), 2U);
  EXPECT_EQ(zones[0].zoneID, kZone);
  EXPECT_EQ(zones[1].zoneID, pictures);
  EXPECT_EQ(database->deleteZone(kZone), nullptr);
  EXPECT_EQ(database->deleteZone(kZone), nullptr);
  EXPECT_TRUE(rz_isError(save(database, {newRecord("a")}), RZErrorZoneNotFound));
}

TEST(RecordStoreTest, ForgetsTheRecordsOfADeletedZone) {
  TestStore store;
  const auto database = store.database();
  ASSERT_EQ(save(database, {newRecord("a"), newRecord("b")}), nullptr);
  ASSERT_EQ(database->deleteZone(kZone), nullptr);
  ASSERT_EQ(database->createZone(kZone), nullptr);
  EXPECT_EQ(fetch(database, "a"), nullptr);
  RZGarbageReport report;
  ASSERT_EQ(store.engine()->collectGarbage(report), nullptr);
  EXPECT_EQ(report.recordsCleared, 2U);
  ASSERT_EQ(store.engine()->collectGarbage(report), nullptr);
  EXPECT_EQ(report.recordsCleared, 0U);
}

TEST(RecordStoreTest, ShowsAZoneToItsMembersAlone) {
  TestStore store;
  const auto ann = store.database();
  ASSERT_EQ(save(ann, {newRecord("a")}), nullptr);
  const RZRecordZoneID annsZone("documents", "ann");
  const auto bob = store.sharedDatabase("bob");
  EXPECT_EQ(fetch(bob, "a", annsZone), nullptr);
  auto& engine = *store.engine();
  ASSERT_EQ(engine.addMember(ann->databaseID(), kZone, {.accountName = "bob"}), nullptr);
  std::vector<RZRecordZone> zones;
  ASSERT_EQ(bob->fetchZones(zones), nullptr);
  ASSERT_EQ(zones.size(), 1U);
  EXPECT_EQ(zones[0].zoneID, annsZone);
  EXPECT_EQ(zones[0].permission, RZZonePermission::ReadOnly);
  const auto record = fetch(bob, "a", annsZone);
  ASSERT_NE(record, nullptr);
  EXPECT_EQ(record->recordID().zoneID(), annsZone);
  ASSERT_EQ(store.sharedDatabase("eve")->fetchZones(zones), nullptr);
  EXPECT_TRUE(zones.empty());
  ASSERT_EQ(engine.removeMember(ann->databaseID(), kZone, "bob"), nullptr);
  EXPECT_EQ(fetch(bob, "a", annsZone), nullptr);
}

TEST(RecordStoreTest, LetsMembersWriteOnlyWhereTheyMay) {
  TestStore store;
  const auto ann = store.database();
  const RZRecordZoneID annsZone("documents", "ann");
  const auto bob = store.sharedDatabase("bob");
  auto& engine = *store.engine();
  ASSERT_EQ(engine.addMember(ann->databaseID(), kZone, {.accountName = "bob"}), nullptr);
  EXPECT_TRUE(rz_isError(save(bob, {newRecord("b", {}, annsZone)}), RZErrorPermissionFailure));
  ASSERT_EQ(engine.addMember(ann->databaseID(), kZone,
                             {.accountName = "bob", .permission = RZZonePermission::ReadWrite}),
            nullptr);
  EXPECT_EQ(save(bob, {newRecord("b", {}, annsZone)}), nullptr);
  EXPECT_NE(fetch(ann, "b"), nullptr);
  EXPECT_TRUE(rz_isError(engine.addMember(bob->databaseID(), annsZone, {.accountName = "eve"}),
                         RZErrorPermissionFailure));
  std::vector<RZZoneMember> members;
  ASSERT_EQ(engine.fetchMembers(ann->databaseID(), kZone, members), nullptr);
  EXPECT_EQ(members, (std::vector<RZZoneMember>{{"bob", RZZonePermission::ReadWrite}}));
}

NSErrorRef whyNotRead(const TestStore& store, const std::string& name) {
  NSErrorRef error;
  EXPECT_EQ(store.database()->fetchRecord(recordID(name), &error), nullptr);
  return error;
}

TEST(RecordStoreTest, ADamagedRecordIsReadByNobodyAndSavedOverByAnybody) {
  TestStore store;
  const auto database = store.database();
  ASSERT_EQ(save(database, {newRecord("a", {{"x", "1"}, {"y", "2"}}), newRecord("b")}), nullptr);
  const auto known = std::make_shared<RZRecord>(*fetch(database, "a"));
  RZQuota before;
  ASSERT_EQ(store.engine()->fetchQuota("ann", before), nullptr);
  damageRecord(store.folder(), "a");
  EXPECT_TRUE(rz_isError(whyNotRead(store, "a"), RZErrorStoreDamaged));
  EXPECT_NE(fetch(database, "b"), nullptr);

  // One that knew it as it was may go on; one that did not is told what to do.
  known->setObject("3", "x");
  EXPECT_TRUE(rz_isError(save(database, {newRecord("a")}), RZErrorServerRecordChanged));
  ASSERT_EQ(save(database, {known}), nullptr);
  EXPECT_EQ(*fetch(database, "a")->valueForKey<std::string>("x"), "3");

  damageRecord(store.folder(), "a");
  ASSERT_EQ(save(database, {newRecord("a", {{"x", "1"}, {"y", "2"}})}, RZRecordSavePolicy::AllKeys),
            nullptr);
  EXPECT_EQ(fetch(database, "a")->values(), newRecord("a", {{"x", "1"}, {"y", "2"}})->values());
  RZQuota after;
  ASSERT_EQ(store.engine()->fetchQuota("ann", after), nullptr);
  EXPECT_EQ(after.used, before.used);
}

TEST(RecordStoreTest, ADamagedRecordCanBeDeleted) {
  TestStore store;
  const auto database = store.database();
  ASSERT_EQ(save(database, {newRecord("a", {{"x", "1"}})}), nullptr);
  damageRecord(store.folder(), "a");
  ASSERT_EQ(remove(database, recordID("a")), nullptr);
  EXPECT_TRUE(rz_isError(whyNotRead(store, "a"), RZErrorUnknownItem));
  RZQuota quota;
  ASSERT_EQ(store.engine()->fetchQuota("ann", quota), nullptr);
  EXPECT_EQ(quota.used, 0U);
}

TEST(RecordStoreTest, RefusesASaveBeyondTheQuotaAndChangesNothing) {
  TestStore store;
  const auto database = store.database();
  ASSERT_EQ(store.engine()->setQuota("ann", 2000), nullptr);
  const RZAsset large = storeText(*store.engine(), std::string(1900, 'x'));
  ASSERT_EQ(save(database, {newRecord("a", {{"content", large}})}), nullptr);
  RZQuota before;
  ASSERT_EQ(store.engine()->fetchQuota("ann", before), nullptr);
  EXPECT_GT(before.used, 1900U);
  EXPECT_TRUE(
      rz_isError(save(database, {newRecord("b", {{"content", large}})}), RZErrorQuotaExceeded));
  EXPECT_EQ(fetch(database, "b"), nullptr);
  RZQuota after;
  ASSERT_EQ(store.engine()->fetchQuota("ann", after), nullptr);
  EXPECT_EQ(after.used, before.used);
  EXPECT_EQ(after.limit, 2000U);
}

TEST(RecordStoreTest, LetsAnAccountOverItsQuotaShrink) {
  TestStore store;
  const auto database = store.database();
  const RZAsset large = storeText(*store.engine(), std::string(1900, 'x'));
  ASSERT_EQ(save(database, {newRecord("a", {{"content", large}, {"x", "1234"}}), newRecord("b")}),
            nullptr);
  ASSERT_EQ(store.engine()->setQuota("ann", 1), nullptr);
  EXPECT_TRUE(rz_isError(change(database, "a", "x", "12345"), RZErrorQuotaExceeded));
  EXPECT_EQ(change(database, "a", "x", "123"), nullptr);
  EXPECT_EQ(remove(database, recordID("a")), nullptr);
  ASSERT_EQ(store.engine()->setQuota("ann", std::nullopt), nullptr);
  EXPECT_EQ(save(database, {newRecord("c", {{"content", large}})}), nullptr);
}

TEST(RecordStoreTest, GivesTheQuotaOfADeletedZoneBackAtOnce) {
  TestStore store;
  ASSERT_EQ(save(store.database(), {newRecord("a")}), nullptr);
  ASSERT_EQ(store.database()->deleteZone(kZone), nullptr);
  RZQuota quota;
  ASSERT_EQ(store.engine()->fetchQuota("ann", quota), nullptr);
  EXPECT_EQ(quota.used, 0U);
}

}  // namespace
}  // namespace yomber
