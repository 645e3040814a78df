#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>

#include "platform/foundation/fault_points.h"
#include "platform/rozzel/fetch_records_operation.h"
#include "provider/testing/thumbnail_fixture.h"

namespace yomber {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::MatchesRegex;
using ::testing::SizeIs;

constexpr const char* kMoreThan =
    "[DEBUG] fetching thumbnails for more than 400 item identifiers, batching request";
constexpr const char* kFinished = "[DEBUG] finished fetching all thumbnail batches";
constexpr const char* kNext = "[DEBUG] fetching next thumbnail batch";

/// Keeps the fetches of a request as they were before the first one ran.
class ThumbnailsWithPlan final : public QSFileProviderExtension {
 public:
  void launchNewFetchThumbnailOperationFrom(const ThumbnailOperations& operations,
                                            const ThumbnailZones& withZoneIDs,
                                            const std::shared_ptr<RZContainer>& inContainer,
                                            const NSErrorRef& previousError,
                                            const ErrorHandler& completionHandler) override {
    if (fetches.empty()) {
      fetches = *operations;
      container = inContainer;
    }
    QSFileProviderExtension::launchNewFetchThumbnailOperationFrom(
        operations, withZoneIDs, inContainer, previousError, completionHandler);
  }

  std::vector<std::shared_ptr<RZFetchRecordsOperation>> fetches;
  std::shared_ptr<RZContainer> container;
};

class ThumbnailFetchesTest : public ThumbnailTest {
 protected:
  ~ThumbnailFetchesTest() override { FaultPoint::disarmAll(); }

  /// Two fetches of the three records of a zone, and one of another owner's.
  std::shared_ptr<ThumbnailsWithPlan> fetchWithPlan() {
    auto planned = std::make_shared<ThumbnailsWithPlan>();
    extension = planned;
    setBatchSize(2);
    addRecords(sameThumbnails(3));
    addRecord(10, "yours", 5, "other", "zone");
    EXPECT_EQ(fetchAll({"d:1000", "d:1001", "d:1002", "d:10"}), nullptr);
    EXPECT_THAT(planned->fetches, SizeIs(3));
    return planned;
  }
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
  static std::string completedLine(const std::string& zone) {
    return "[DEBUG] completed fetching thumbnail batch for " + zone;
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
  expectLines(
      {completedLine("zone (__currentUser__)"), kNext, completedLine("zone (other)"), kFinished});
}

TEST_F(ThumbnailFetchesTest, EveryFetchAsksForTheImageBeforeTheSizeAtOnceAndOnlyOnce) {
  const auto planned = fetchWithPlan();
  for (const auto& fetch : planned->fetches) {
    ASSERT_TRUE(fetch->desiredKeys().has_value());
    EXPECT_THAT(*fetch->desiredKeys(),
                ElementsAre(kQSRecordKeyThumbnail1024x1024, kQSRecordKeySize));
    EXPECT_EQ(static_cast<int>(fetch->qualityOfService()), 17);
    EXPECT_EQ(fetch->configuration().discretionaryNetworkBehavior(), 0);
    EXPECT_FALSE(fetch->configuration().automaticallyRetryNetworkFailures());
  }
}

TEST_F(ThumbnailFetchesTest, EveryFetchIsTheDaemonsAndOfTheRequestsOneGroup) {
  const auto planned = fetchWithPlan();
  EXPECT_EQ(planned->container->sourceApplicationBundleIdentifier(), QSDaemonBundleID);
  const auto group = planned->fetches.front()->group();
  ASSERT_NE(group, nullptr);
  EXPECT_EQ(group->name(), "download-thumbnails-user-initiated");
  for (const auto& fetch : planned->fetches) {
    EXPECT_EQ(fetch->configuration().sourceApplicationBundleIdentifier(), QSDaemonBundleID);
    EXPECT_EQ(fetch->group(), group);
  }
}

TEST_F(ThumbnailFetchesTest, EachFetchIsLoggedWithItsRecordsItsGroupAndItsZone) {
  const auto planned = fetchWithPlan();
  std::vector<std::string> fetches;
  for (const auto& fetch : planned->fetches) fetches.push_back(fetch->description());
  const std::string operation = "<yomber::RZFetchRecordsOperation: 0x[0-9a-f]+> of ";
  const std::string group = " records \\(download-thumbnails-user-initiated\\)";
  ASSERT_THAT(fetches, ElementsAre(MatchesRegex(operation + "3" + group),
                                   MatchesRegex(operation + "3" + group),
                                   MatchesRegex(operation + "1" + group)));
  const std::string scheduling = "[DEBUG] scheduling operation ";
  expectLines({scheduling + fetches[0] + " for zone: zone (__currentUser__)",
               completedLine("zone (__currentUser__)"),
               scheduling + fetches[1] + " for zone: zone (__currentUser__)",
               completedLine("zone (__currentUser__)"),
               scheduling + fetches[2] + " for zone: zone (other)", completedLine("zone (other)")});
}

TEST_F(ThumbnailFetchesTest, TheFailureOfABatchSticksWhenALaterOneSucceeds) {
  know(5, {"5", RZRecordZoneID("a zone that is gone")});
  addRecord(10, "picture", 5, "someone", "zone");
  const NSErrorRef error = fetchAll({"d:5", "d:10"});
  ASSERT_EQ(domainAndCode(error), "RZErrorDomain 26");
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

TEST_F(ThumbnailFetchesTest, OfTwoFailuresTheLastIsToldThoughAThirdBatchSucceeds) {
  know(5, {"5", RZRecordZoneID("a zone that is gone")});
  addRecord(10, "ten", 5, "someone", "b");
  addRecord(20, "twenty", 5, "someone", "c");
  const std::string offline = daemon.home() + "/store/offline";
  whenAnswered = [&](const std::string& identifier) {
    if (identifier == "d:5") std::ofstream(offline) << "x";
    if (identifier == "d:10") std::filesystem::remove(offline);
  };
  const NSErrorRef error = fetchAll({"d:5", "d:10", "d:20"});
  ASSERT_EQ(domainAndCode(error), "RZErrorDomain 2");
  const auto answers = thumbnails->values();
  ASSERT_THAT(answers, SizeIs(3));
  ASSERT_EQ(domainAndCode(answers[0].error), "RZErrorDomain 26");
  EXPECT_EQ(domainAndCode(answers[1].error), "RZErrorDomain 2");
  EXPECT_EQ(answers[2].image(), "twenty");
  expectLines(
      {failureLine("a zone that is gone (__currentUser__)", answers[0].error->description()), kNext,
       failureLine("b (__currentUser__)", error->description()), kNext, kFinished});
}

TEST_F(ThumbnailFetchesTest, AFetchThatFailsIsFollowedByTheNextOneOfItsZone) {
  setBatchSize(2);
  addRecords(sameThumbnails(3));
  ASSERT_EQ(FaultPoint::arm("rozzel.fetch.part=error"), nullptr);
  whenAnswered = [](const std::string&) { FaultPoint::disarmAll(); };
  const NSErrorRef error = fetchAll(identifiersOf(1000, 3));
  ASSERT_EQ(domainAndCode(error), "RZErrorDomain 2");
  EXPECT_THAT(error->description(), HasSubstr("the fetch was told to fail"));
  std::vector<std::string> images;
  std::vector<std::string> failures;
  for (const auto& each : thumbnails->values()) {
    images.push_back(each.image());
    failures.push_back(domainAndCode(each.error));
  }
  EXPECT_THAT(images, ElementsAre("nil", "nil", "nil", "picture", "picture", "picture"));
  const std::string unreachable = "RZErrorDomain 2";
  EXPECT_THAT(failures, ElementsAre(unreachable, unreachable, unreachable, "nil", "nil", "nil"));
  const std::string zone = "zone (__currentUser__)";
  expectLines({completedLine(zone), failureLine(zone, error->description()), kNext,
               completedLine(zone), kFinished});
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

TEST_F(ThumbnailFetchesTest, CancellingDuringTheSecondFetchLeavesTheFirstAndEndsTheOthers) {
  setBatchSize(2);
  addRecords(sameThumbnails(5));
  Gate reached;
  Gate goOn;
  int answers = 0;
  whenAnswered = [&](const std::string&) {
    if (++answers != 6) return;  // each fetch asks for the five of the zone
    reached.open();
    EXPECT_TRUE(goOn.wait());
  };
  const auto progress = fetch(identifiersOf(1000, 5));
  ASSERT_TRUE(reached.wait());
  progress->cancel();
  goOn.open();
  const NSErrorRef error = only(errors);
  ASSERT_EQ(domainAndCode(error), "NSCocoaErrorDomain 3072");
  std::vector<std::string> delivered;
  for (const auto& each : thumbnails->values()) delivered.push_back(each.identifier);
  EXPECT_THAT(delivered, ElementsAre("d:1000", "d:1001", "d:1002", "d:1003", "d:1004", "d:1000"));
  const std::string zone = "zone (__currentUser__)";
  const std::string cancelled = failureLine(zone, error->description());
  expectLines({completedLine(zone), kNext, completedLine(zone), cancelled, kNext,
               completedLine(zone), cancelled, kFinished});
}

}  // namespace
}  // namespace yomber
