#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <fstream>

#include "platform/rozzel/fetch_records_operation.h"
#include "provider/testing/thumbnail_fixture.h"

namespace yomber {
namespace {

using ::testing::Each;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::SizeIs;

constexpr const char* kMoreThan =
    "[DEBUG] fetching thumbnails for more than 400 item identifiers, batching request";
constexpr const char* kFinished = "[DEBUG] finished fetching all thumbnail batches";
constexpr const char* kNext = "[DEBUG] fetching next thumbnail batch";

class ThumbnailFetchesTest : public ThumbnailTest {
 protected:
  std::vector<std::size_t> batchSizes(std::size_t count) {
    std::vector<RZRecordID> ids;
    for (std::size_t i = 0; i < count; ++i) {
      ids.emplace_back(std::to_string(i), RZRecordZoneID("zone"));
    }
    std::vector<std::size_t> sizes;
    extension->batchRecordIDsToFetchThumbnails(
        ids, [&](const std::vector<RZRecordID>& batch) { sizes.push_back(batch.size()); });
    EXPECT_THAT(ids, IsEmpty());
    return sizes;
  }
  static std::string failureLine(const std::string& zone, const std::string& error) {
    return "[ERROR] error while fetching thumbnail batch for " + zone + ": " + error;
  }
  std::map<std::uint64_t, std::optional<std::string>> sameThumbnails(std::uint64_t count) {
    std::map<std::uint64_t, std::optional<std::string>> result;
    for (std::uint64_t i = 0; i < count; ++i) result.emplace(1000 + i, "picture");
    return result;
  }
};

TEST_F(ThumbnailFetchesTest, BatchesHoldAsManyAsAFetchTakesAndAFullOneIsSaidToBeMore) {
  setBatchSize(400);
  EXPECT_THAT(batchSizes(0), IsEmpty());
  EXPECT_THAT(batchSizes(399), ElementsAre(399));
  EXPECT_EQ(log.countContaining("more than"), 0U);
  EXPECT_THAT(batchSizes(400), ElementsAre(400));
  EXPECT_EQ(log.count(LogLevel::Debug, kMoreThan), 1U);
  log.forget();
  EXPECT_THAT(batchSizes(401), ElementsAre(400, 1));
  EXPECT_EQ(log.count(LogLevel::Debug, kMoreThan), 1U);
  log.forget();
  EXPECT_THAT(batchSizes(1200), ElementsAre(400, 400, 400));
  EXPECT_EQ(log.count(LogLevel::Debug, kMoreThan), 3U);
}

TEST_F(ThumbnailFetchesTest, FourHundredRecordsAreOneFetchAndOneMoreMakesTwoOfTheWholeZone) {
  setBatchSize(400);
  addRecords(sameThumbnails(400));
  EXPECT_EQ(fetchAll(identifiersOf(1000, 400)), nullptr);
  EXPECT_THAT(thumbnails->values(), SizeIs(400));
  EXPECT_EQ(log.count(LogLevel::Debug, kMoreThan), 1U);
  EXPECT_EQ(log.countContaining("scheduling operation"), 1U);
  EXPECT_EQ(log.countContaining("of 400 records"), 1U);
  addRecord(1400, "picture");
  log.forget();
  const auto again = std::make_shared<Awaited<NSErrorRef>>();
  (void)extension->fetchThumbnailsForItemIdentifiers(
      identifiersOf(1000, 401), {.width = 1, .height = 1}, TypedThumbnailHandler(), into(again));
  EXPECT_EQ(only(again), nullptr);
  EXPECT_EQ(log.count(LogLevel::Debug, kMoreThan), 1U);
  EXPECT_EQ(log.countContaining("scheduling operation"), 2U);
  EXPECT_EQ(log.countContaining("of 401 records"), 2U);
  EXPECT_EQ(log.count(LogLevel::Debug, kNext), 1U);
  EXPECT_EQ(log.countContaining("received a thumbnail callback"), 802U);
}

TEST_F(ThumbnailFetchesTest, TwoZonesOfTwoOwnersAreFetchedOneAfterTheOther) {
  addRecord(10, "mine", 5, "someone", "zone");
  addRecord(20, "yours", 5, "other", "zone");
  EXPECT_EQ(fetchAll({"d:10", "d:20"}), nullptr);
  std::map<std::string, std::string> images;
  for (const auto& each : thumbnails->values()) images[each.identifier] = each.image();
  const std::map<std::string, std::string> expected{{"d:10", "mine"}, {"d:20", "yours"}};
  EXPECT_EQ(images, expected);
  expectLines({"[DEBUG] completed fetching thumbnail batch for zone (__currentUser__)", kNext,
               "[DEBUG] completed fetching thumbnail batch for zone (other)", kFinished});
}

TEST_F(ThumbnailFetchesTest, TheFailureOfABatchSticksWhenALaterOneSucceeds) {
  know(5, {"5", RZRecordZoneID("a zone that is gone")});
  addRecord(10, "picture", 5, "someone", "zone");
  const NSErrorRef error = fetchAll({"d:5", "d:10"});
  EXPECT_EQ(domainAndCode(error), "RZErrorDomain 26");
  const auto answers = thumbnails->values();
  ASSERT_THAT(answers, SizeIs(2));
  EXPECT_EQ(answers[0].identifier, "d:5");
  EXPECT_EQ(domainAndCode(answers[0].error), "RZErrorDomain 26");
  EXPECT_EQ(answers[1].image(), "picture");
  EXPECT_EQ(log.count(LogLevel::Error,
                      failureLine("a zone that is gone (__currentUser__)", error->description())),
            1U);
  EXPECT_EQ(log.count(LogLevel::Debug, kFinished), 1U);
}

TEST_F(ThumbnailFetchesTest, AStoreOutOfReachFailsEveryRecordAndTheRequest) {
  addRecord(10, "picture");
  std::ofstream(daemon.home() + "/store/offline") << "x";
  EXPECT_EQ(domainAndCode(fetchAll({"d:10"})), "RZErrorDomain 2");
  EXPECT_EQ(domainAndCode(onlyThumbnail().error), "RZErrorDomain 2");
}

TEST_F(ThumbnailFetchesTest, AnEmptyChainCompletesWithThePreviousError) {
  const auto operations = std::make_shared<std::vector<std::shared_ptr<RZFetchRecordsOperation>>>();
  const auto zones = std::make_shared<std::vector<RZRecordZoneID>>();
  const auto loggedOut = NSError::errorWithDomain(QSOstrellErrorDomain, QSOstrellErrorLoggedOut);
  extension->launchNewFetchThumbnailOperationFrom(operations, zones, nullptr, nullptr,
                                                  into(errors));
  extension->launchNewFetchThumbnailOperationFrom(operations, zones, nullptr, loggedOut,
                                                  into(errors));
  ASSERT_THAT(errors->values(), SizeIs(2));
  EXPECT_EQ(errors->values()[0], nullptr);
  EXPECT_EQ(domainAndCode(errors->values()[1]), "NSFileProviderErrorDomain -1000");
}

TEST_F(ThumbnailFetchesTest, CancellingTheProgressCancelsEveryFetchOfTheRequest) {
  setBatchSize(2);
  addRecords(sameThumbnails(5));
  Gate reached;
  Gate goOn;
  whenAnswered = [&](const std::string&) {
    reached.open();
    EXPECT_TRUE(goOn.wait());
  };
  const auto progress = fetch(identifiersOf(1000, 5));
  ASSERT_TRUE(reached.wait());
  EXPECT_TRUE(progress->isCancellable());
  progress->cancel();
  goOn.open();
  EXPECT_EQ(domainAndCode(only(errors)), "NSCocoaErrorDomain 3072");
  EXPECT_THAT(thumbnails->values(), SizeIs(1));
  EXPECT_EQ(log.countContaining("error while fetching thumbnail batch"), 3U);
  EXPECT_EQ(progress->totalUnitCount(), 0);
  EXPECT_EQ(progress->completedUnitCount(), 0);
}

}  // namespace
}  // namespace yomber
