#include <gtest/gtest.h>

#include <memory>

#include "platform/rozzel/container.h"
#include "platform/rozzel/embedded_engine.h"
#include "platform/rozzel/errors.h"
#include "platform/rozzel/hashed_copy.h"
#include "platform/rozzel/record.h"

namespace yomber {
namespace {

const RZRecordZoneID kZone("documents");

TEST(RecordTest, RemembersWhichKeysWereSetOrRemoved) {
  RZRecord record("document", {"a", kZone}, {{"size", 5}, {"name", "x"}}, {.changeTag = "1"});
  EXPECT_TRUE(record.changedKeys().empty());
  record.setObject(6, "size");
  record.removeObjectForKey("name");
  EXPECT_EQ(record.changedKeys(), (std::set<std::string>{"name", "size"}));
  EXPECT_EQ(*record.valueForKey<std::int64_t>("size"), 6);
  EXPECT_EQ(record.objectForKey("name"), nullptr);
}

TEST(RecordTest, AnswersAValueOnlyAsWhatItIs) {
  RZRecord record("document", {"a", kZone});
  record.setObject("text", "key");
  EXPECT_NE(record.valueForKey<std::string>("key"), nullptr);
  EXPECT_EQ(record.valueForKey<RZBytes>("key"), nullptr);
  EXPECT_EQ(record.valueForKey<std::int64_t>("other"), nullptr);
}

TEST(RecordTest, ListsItsAssetsOncePerKey) {
  RZRecord record("document", {"a", kZone});
  const RZAsset asset{.hash = {1, 2, 3}, .size = 4};
  record.setObject(asset, "content");
  record.setObject(asset, "thumbnail");
  EXPECT_EQ(record.assets(), (std::vector<RZAsset>{asset, asset}));
}

TEST(AssetTest, PrintsItsHashAndReadsItBack) {
  const RZAsset asset{.hash = {0x00, 0x9f, 0xff}, .size = 7};
  EXPECT_TRUE(asset.hexHash().starts_with("009fff00"));
  EXPECT_EQ(RZAsset::fromHexHash(asset.hexHash(), 7), asset);
}

TEST(AssetTest, RefusesTextsThatAreNoHash) {
  EXPECT_FALSE(RZAsset::fromHexHash("", 0));
  EXPECT_FALSE(RZAsset::fromHexHash(std::string(63, '0'), 0));
  EXPECT_FALSE(RZAsset::fromHexHash(std::string(64, 'g'), 0));
  EXPECT_FALSE(RZAsset::fromHexHash(std::string(64, 'A'), 0));
}

TEST(ErrorTest, CarriesTheServersRecordAndEveryRefusedOne) {
  const auto server = std::make_shared<RZRecord>("document", RZRecordID("a", kZone));
  const NSErrorRef changed = rz_error(RZErrorServerRecordChanged, "changed",
                                      {{RZErrorServerRecordKey, NSObjectRef(server)}});
  const NSErrorRef unknown = rz_error(RZErrorUnknownItem, "gone");
  const NSErrorRef batch = rz_batchError({{{"a", kZone}, changed}, {{"b", kZone}, unknown}});
  EXPECT_TRUE(rz_isError(batch, RZErrorServerRecordChanged));
  EXPECT_EQ(rz_serverRecord(batch), server);
  ASSERT_EQ(rz_failedRecords(batch).size(), 2U);
  EXPECT_EQ(rz_failedRecords(batch)[1].first.recordName(), "b");
  EXPECT_EQ(rz_failedRecords(batch)[1].second, unknown);
}

TEST(ErrorTest, NilHasNothingToSay) {
  EXPECT_EQ(rz_batchError({}), nullptr);
  EXPECT_EQ(rz_serverRecord(nullptr), nullptr);
  EXPECT_TRUE(rz_failedRecords(nullptr).empty());
  EXPECT_FALSE(rz_isTransient(nullptr));
}

TEST(ContainerTest, OwnZonesAreInThePrivateDatabaseAndOthersInTheShared) {
  const RZContainer container(nullptr, "com.example.drive", "ann");
  EXPECT_EQ(container.databaseForZone(kZone), container.privateCloudDatabase());
  EXPECT_EQ(container.databaseForZone(RZRecordZoneID("documents", "ann")),
            container.privateCloudDatabase());
  EXPECT_EQ(container.databaseForZone(RZRecordZoneID("documents", "bob")),
            container.sharedCloudDatabase());
}

}  // namespace
}  // namespace yomber
