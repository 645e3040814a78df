#include <gtest/gtest.h>
#include <time.h>

#include <algorithm>
#include <memory>
#include <string>
#include <vector>

#include "platform/rozzel/test_store.h"

namespace yomber {
namespace {

RZChangePage changesSince(const RZDatabaseRef& database, const RZChangeToken& token,
                          std::size_t limit = 100, const RZRecordZoneID& zone = kZone) {
  RZChangePage page;
  EXPECT_EQ(database->fetchChanges(zone, token, limit, {}, page), nullptr);
  return page;
}

NSErrorRef errorOfChangesSince(const RZDatabaseRef& database, const RZChangeToken& token,
                               const RZRecordZoneID& zone = kZone) {
  RZChangePage page;
  return database->fetchChanges(zone, token, 100, {}, page);
}

/// "a" for a record, "-a" for a deletion.
std::vector<std::string> namesOf(const RZChangePage& page) {
  std::vector<std::string> names;
  for (const auto& change : page.changes) {
    names.push_back((change.record ? "" : "-") + change.recordID.recordName());
  }
  return names;
}

using Names = std::vector<std::string>;

TEST(RecordFeedTest, TellsChangesInTheirOrderAndEachRecordOnce) {
  TestStore store;
  const auto database = store.database();
  ASSERT_EQ(save(database, {newRecord("a"), newRecord("b"), newRecord("c")}), nullptr);
  ASSERT_EQ(change(database, "a", "x", 1), nullptr);
  const auto page = changesSince(database, {});
  EXPECT_EQ(namesOf(page), (Names{"b", "c", "a"}));
  EXPECT_EQ(*page.changes[2].record->valueForKey<std::int64_t>("x"), 1);
  EXPECT_FALSE(page.moreComing);
}

TEST(RecordFeedTest, TellsOfADamagedRecordThatItCannotBeReadAndGoesOn) {
  TestStore store;
  const auto database = store.database();
  ASSERT_EQ(save(database, {newRecord("a"), newRecord("b"), newRecord("c")}), nullptr);
  damageRecord(store.folder(), "b");
  const auto page = changesSince(database, {});
  ASSERT_EQ(page.changes.size(), 3U);
  EXPECT_EQ(page.changes[1].recordID, recordID("b"));
  EXPECT_EQ(page.changes[1].record, nullptr);
  EXPECT_TRUE(rz_isError(page.changes[1].error, RZErrorStoreDamaged));
  for (const std::size_t sound : {0U, 2U}) {
    EXPECT_NE(page.changes[sound].record, nullptr);
    EXPECT_EQ(page.changes[sound].error, nullptr);
  }
  EXPECT_TRUE(changesSince(database, page.token).changes.empty());
}

TEST(RecordFeedTest, TellsOnlyWhatIsNewSinceTheToken) {
  TestStore store;
  const auto database = store.database();
  ASSERT_EQ(save(database, {newRecord("a"), newRecord("b")}), nullptr);
  auto token = changesSince(database, {}).token;
  EXPECT_TRUE(changesSince(database, token).changes.empty());
  ASSERT_EQ(remove(database, recordID("a")), nullptr);
  ASSERT_EQ(change(database, "b", "x", 1), nullptr);
  const auto page = changesSince(database, token);
  EXPECT_EQ(namesOf(page), (Names{"-a", "b"}));
  EXPECT_EQ(page.changes[0].recordType, "document");
  EXPECT_TRUE(changesSince(database, page.token).changes.empty());
}

TEST(RecordFeedTest, TellsOfNoDeletionThatWasTakenBack) {
  TestStore store;
  const auto database = store.database();
  ASSERT_EQ(save(database, {newRecord("a")}), nullptr);
  const auto token = changesSince(database, {}).token;
  ASSERT_EQ(remove(database, recordID("a")), nullptr);
  ASSERT_EQ(save(database, {newRecord("a")}), nullptr);
  EXPECT_EQ(namesOf(changesSince(database, token)), (Names{"a"}));
}

TEST(RecordFeedTest, TellsANewReaderNothingOfOldDeletions) {
  TestStore store;
  const auto database = store.database();
  ASSERT_EQ(save(database, {newRecord("a"), newRecord("b")}), nullptr);
  ASSERT_EQ(remove(database, recordID("a")), nullptr);
  EXPECT_EQ(namesOf(changesSince(database, {})), (Names{"b"}));
}

TEST(RecordFeedTest, GoesOnWhereAPageEnded) {
  TestStore store;
  const auto database = store.database();
  std::vector<RZRecordRef> records;
  for (char name = 'a'; name <= 'g'; ++name) records.push_back(newRecord(std::string(1, name)));
  ASSERT_EQ(save(database, records), nullptr);
  Names names;
  RZChangePage page;
  int pages = 0;
  do {
    page = changesSince(database, page.token, 3);
    EXPECT_LE(page.changes.size(), 3U);
    for (const auto& name : namesOf(page)) names.push_back(name);
    // What happens between two pages comes later, not never.
    if (++pages == 1) {
      ASSERT_EQ(remove(database, recordID("a")), nullptr);
      ASSERT_EQ(remove(database, recordID("g")), nullptr);
      ASSERT_EQ(change(database, "d", "x", 1), nullptr);
    }
  } while (page.moreComing);
  EXPECT_EQ(names, (Names{"a", "b", "c", "e", "f", "-a", "-g", "d"}));
}

TEST(RecordFeedTest, BringsOnlyTheDesiredKeys) {
  TestStore store;
  ASSERT_EQ(save(store.database(), {newRecord("a", {{"x", 1}, {"y", 2}})}), nullptr);
  RZChangePage page;
  ASSERT_EQ(store.database()->fetchChanges(kZone, {}, 10, RZDesiredKeys{{std::string("x")}}, page),
            nullptr);
  EXPECT_EQ(page.changes[0].record->values(), (RZValues{{"x", 1}}));
}

TEST(RecordFeedTest, SaysWhenATokenIsTooOld) {
  TestStore store({.maximumTombstones = 10});
  const auto database = store.database();
  std::vector<RZRecordRef> records;
  for (int index = 0; index < 20; ++index) records.push_back(newRecord(std::to_string(index)));
  ASSERT_EQ(save(database, records), nullptr);
  const auto before = changesSince(database, {}).token;
  for (int index = 0; index < 11; ++index) {
    ASSERT_EQ(remove(database, recordID(std::to_string(index))), nullptr);
  }
  EXPECT_EQ(changesSince(database, before).changes.size(), 11U);
  const auto later = changesSince(database, {}).token;
  ASSERT_EQ(remove(database, recordID("11")), nullptr);
  EXPECT_TRUE(rz_isError(errorOfChangesSince(database, before), RZErrorChangeTokenExpired));
  EXPECT_EQ(namesOf(changesSince(database, later)), (Names{"-11"}));
}

TEST(RecordFeedTest, LetsANewReaderFinishAlthoughDeletionsWereForgottenBefore) {
  TestStore store({.maximumTombstones = 2});
  const auto database = store.database();
  std::vector<RZRecordRef> records;
  for (int index = 0; index < 10; ++index) records.push_back(newRecord(std::to_string(index)));
  ASSERT_EQ(save(database, records), nullptr);
  for (int index = 4; index < 10; ++index) {
    ASSERT_EQ(remove(database, recordID(std::to_string(index))), nullptr);
  }
  Names names;
  RZChangePage page;
  do {
    page = changesSince(database, page.token, 1);
    for (const auto& name : namesOf(page)) names.push_back(name);
  } while (page.moreComing);
  EXPECT_EQ(names, (Names{"0", "1", "2", "3"}));
}

TEST(RecordFeedTest, RefusesTokensThatAreNotOfThisZone) {
  TestStore store;
  TestStore otherStore;
  const auto database = store.database();
  const RZRecordZoneID pictures("pictures");
  ASSERT_EQ(database->createZone(pictures), nullptr);
  const auto token = changesSince(database, {}).token;
  const auto isExpired = [&](const RZChangeToken& bad, const RZDatabaseRef& in,
                             const RZRecordZoneID& zone) {
    return rz_isError(errorOfChangesSince(in, bad, zone), RZErrorChangeTokenExpired);
  };
  EXPECT_TRUE(isExpired(token, database, pictures));
  EXPECT_TRUE(isExpired(token, otherStore.database(), kZone));
  EXPECT_TRUE(isExpired("nonsense", database, kZone));
  EXPECT_TRUE(isExpired(token.substr(1), database, kZone));
  for (std::size_t index = 0; index < token.size(); ++index) {
    RZChangeToken flipped = token;
    flipped[index] = static_cast<char>(flipped[index] ^ 1);
    EXPECT_TRUE(isExpired(flipped, database, kZone)) << "byte " << index;
  }
  ASSERT_EQ(database->deleteZone(kZone), nullptr);
  ASSERT_EQ(database->createZone(kZone), nullptr);
  EXPECT_TRUE(isExpired(token, database, kZone));
}

TEST(RecordFeedTest, ShowsByTheTagOfAZoneWhetherItChanged) {
  TestStore store;
  const auto tag = [&] {
    std::vector<RZRecordZone> zones;
    EXPECT_EQ(store.database()->fetchZones(zones), nullptr);
    return zones.at(0).changeTag;
  };
  const auto first = tag();
  EXPECT_EQ(tag(), first);
  ASSERT_EQ(save(store.database(), {newRecord("a")}), nullptr);
  const auto second = tag();
  EXPECT_NE(second, first);
  ASSERT_EQ(remove(store.database(), recordID("a")), nullptr);
  EXPECT_NE(tag(), second);
}

TEST(RecordQueryTest, FindsRecordsOfATypeByName) {
  TestStore store;
  const auto database = store.database();
  const auto folder = std::make_shared<RZRecord>("folder", recordID("b"));
  ASSERT_EQ(save(database, {newRecord("c"), folder, newRecord("a"), newRecord("d")}), nullptr);
  RZQueryPage page;
  ASSERT_EQ(database->queryRecords({.zoneID = kZone, .recordType = "document"}, {}, 2, page),
            nullptr);
  ASSERT_EQ(page.records.size(), 2U);
  EXPECT_EQ(page.records[0]->recordID(), recordID("a"));
  EXPECT_EQ(page.records[1]->recordID(), recordID("c"));
  ASSERT_FALSE(page.cursor.empty());
  ASSERT_EQ(
      database->queryRecords({.zoneID = kZone, .recordType = "document"}, page.cursor, 2, page),
      nullptr);
  ASSERT_EQ(page.records.size(), 1U);
  EXPECT_EQ(page.records[0]->recordID(), recordID("d"));
  EXPECT_TRUE(page.cursor.empty());
}

TEST(RecordQueryTest, RefusesACursorThatIsNone) {
  TestStore store;
  RZQueryPage page;
  EXPECT_TRUE(rz_isError(store.database()->queryRecords({.zoneID = kZone}, "nonsense", 1, page),
                         RZErrorInvalidArguments));
}

TEST(RecordQueryTest, EndsAPageOfLargeRecordsBeforeItsLimit) {
  TestStore store;
  const std::string large(900'000, 'x');
  for (int index = 0; index < 12; ++index) {
    ASSERT_EQ(save(store.database(), {newRecord(std::to_string(index), {{"x", large}})}), nullptr);
  }
  RZQueryPage page;
  ASSERT_EQ(store.database()->queryRecords({.zoneID = kZone}, {}, 100, page), nullptr);
  EXPECT_LT(page.records.size(), 12U);
  std::size_t count = page.records.size();
  while (!page.cursor.empty()) {
    ASSERT_EQ(store.database()->queryRecords({.zoneID = kZone}, page.cursor, 100, page), nullptr);
    count += page.records.size();
  }
  EXPECT_EQ(count, 12U);
  EXPECT_LT(changesSince(store.database(), {}).changes.size(), 12U);
}

constexpr int kManyRecords = 100'000;

void saveMany(const RZDatabaseRef& database) {
  for (int first = 0; first < kManyRecords; first += 2000) {
    std::vector<RZRecordRef> records;
    for (int index = first; index < first + 2000; ++index) {
      // Names in another order than that of the changes.
      records.push_back(newRecord(std::to_string((index * 7919LL) % kManyRecords), {{"x", index}}));
    }
    ASSERT_EQ(save(database, records), nullptr);
  }
}

/// Microseconds of this thread's processor time, so that a busy machine does not count.
std::int64_t threadTime() {
  timespec time{};
  clock_gettime(CLOCK_THREAD_CPUTIME_ID, &time);
  return time.tv_sec * 1'000'000 + time.tv_nsec / 1000;
}

/// The cheapest of the first and of the last pages, in microseconds.
struct PageCosts {
  std::vector<std::int64_t> costs;
  [[nodiscard]] std::int64_t first() const {
    return *std::min_element(costs.begin(), costs.begin() + 20);
  }
  [[nodiscard]] std::int64_t last() const {
    return *std::min_element(costs.end() - 21, costs.end() - 1);
  }
};

TEST(RecordQueryTest, PagesThroughAHundredThousandRecordsAtConstantCost) {
  TestStore store;
  const auto database = store.database();
  saveMany(database);
  PageCosts queried;
  RZQueryPage page;
  int count = 0;
  std::string last;
  do {
    const auto start = threadTime();
    ASSERT_EQ(database->queryRecords({.zoneID = kZone}, page.cursor, 200, page), nullptr);
    queried.costs.push_back(threadTime() - start);
    for (const auto& record : page.records) {
      ASSERT_LT(last, record->recordID().recordName());
      last = record->recordID().recordName();
    }
    count += static_cast<int>(page.records.size());
  } while (!page.cursor.empty());
  EXPECT_EQ(count, kManyRecords);
  EXPECT_LT(queried.last(), 3 * queried.first() + 200);

  PageCosts changed;
  RZChangePage changes;
  count = 0;
  do {
    const auto start = threadTime();
    changes = changesSince(database, changes.token, 200);
    changed.costs.push_back(threadTime() - start);
    count += static_cast<int>(changes.changes.size());
  } while (changes.moreComing);
  EXPECT_EQ(count, kManyRecords);
  EXPECT_LT(changed.last(), 3 * changed.first() + 200);
  RecordProperty("query_page_us", static_cast<int>(queried.last()));
  RecordProperty("change_page_us", static_cast<int>(changed.last()));
}

}  // namespace
}  // namespace yomber
