#include "platform/rozzel/fetch_records_operation.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <fstream>
#include <iterator>
#include <string>
#include <vector>

#include "platform/foundation/fault_points.h"
#include "platform/foundation/gate.h"
#include "platform/foundation/lock.h"
#include "platform/rozzel/test_store.h"

namespace yomber {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;

/// What an operation handed over, and how it ended.
struct Fetch {
  struct Delivery {
    RZRecordRef record;
    RZRecordID recordID;
    NSErrorRef error;
  };
  Mutex mutex;
  std::vector<Delivery> deliveries GUARDED_BY(mutex);
  std::vector<NSErrorRef> endings GUARDED_BY(mutex);
  Gate ended;

  std::vector<Delivery> all() {
    LockGuard guard(mutex);
    return deliveries;
  }
  std::vector<std::string> names() {
    std::vector<std::string> result;
    for (const auto& each : all()) result.push_back(each.recordID.recordName());
    return result;
  }
  NSErrorRef onlyEnding() {
    LockGuard guard(mutex);
    EXPECT_EQ(endings.size(), 1U);
    return endings.empty() ? nullptr : endings.front();
  }
};

class FetchRecordsOperationTest : public testing::Test {
 protected:
  ~FetchRecordsOperationTest() override { FaultPoint::disarmAll(); }

  std::shared_ptr<RZFetchRecordsOperation> operationFor(std::vector<std::string> names,
                                                        const RZRecordZoneID& zone = kZone) {
    auto operation = std::make_shared<RZFetchRecordsOperation>();
    std::vector<RZRecordID> ids;
    for (auto& name : names) ids.push_back(recordID(name, zone));
    operation->setRecordIDs(std::move(ids));
    operation->setPerRecordCompletionBlock(
        [this](const RZRecordRef& record, const RZRecordID& id, NSErrorRef error) {
          if (whenDelivered) whenDelivered(id);
          LockGuard guard(fetch_.mutex);
          fetch_.deliveries.push_back({record, id, std::move(error)});
        });
    operation->setFetchRecordsCompletionBlock([this](NSErrorRef error) {
      {
        LockGuard guard(fetch_.mutex);
        fetch_.endings.push_back(std::move(error));
      }
      fetch_.ended.open();
    });
    return operation;
  }
  void run(const std::shared_ptr<RZFetchRecordsOperation>& operation) {
    store.database()->addOperation(operation);
    ASSERT_TRUE(fetch_.ended.wait());
  }
  std::vector<std::string> saveMany(std::size_t count) const {
    std::vector<std::string> names;
    std::vector<RZRecordRef> records;
    for (std::size_t i = 0; i < count; ++i) {
      names.push_back("r" + std::to_string(i));
      records.push_back(newRecord(names.back()));
    }
    EXPECT_EQ(save(store.database(), std::move(records)), nullptr);
    return names;
  }
  void takeOffline() const { std::ofstream(store.folder() + "/offline") << "x"; }

  TestStore store;
  std::function<void(const RZRecordID&)> whenDelivered;
  Fetch fetch_;
};

TEST_F(FetchRecordsOperationTest, HandsOverEachRecordInTheOrderAskedForWithTheDesiredKeysOnly) {
  const auto names = saveMany(600);
  ASSERT_EQ(change(store.database(), "r1", "size", std::int64_t{7}), nullptr);
  ASSERT_EQ(change(store.database(), "r1", "name", std::string("x")), nullptr);
  const auto operation = operationFor(names);
  operation->setDesiredKeys(std::vector<std::string>{"size"});
  run(operation);
  EXPECT_EQ(fetch_.names(), names);
  const RZRecordRef record = fetch_.all().at(1).record;
  ASSERT_NE(record, nullptr);
  EXPECT_EQ(*record->valueForKey<std::int64_t>("size"), 7);
  EXPECT_EQ(record->objectForKey("name"), nullptr);
  EXPECT_EQ(fetch_.onlyEnding(), nullptr);
  EXPECT_TRUE(operation->isFinished());
}

TEST_F(FetchRecordsOperationTest, NamesTheStoresOwnFileOfAnAssetThatIsHere) {
  const RZAsset here = storeText(*store.engine(), "a picture");
  const RZAsset lost = storeText(*store.engine(), "another picture");
  ASSERT_EQ(save(store.database(), {newRecord("here", {{"thumbnail", here}}),
                                    newRecord("lost", {{"thumbnail", lost}})}),
            nullptr);
  ASSERT_EQ(unlink(store.pathOf(lost).c_str()), 0);
  run(operationFor({"here", "lost"}));
  const auto deliveries = fetch_.all();
  ASSERT_EQ(deliveries.size(), 2U);
  EXPECT_EQ(deliveries[0].record->assetFile("thumbnail"), store.pathOf(here));
  EXPECT_EQ(deliveries[0].record->assetFile("other"), std::nullopt);
  EXPECT_EQ(deliveries[1].record->assetFile("thumbnail"), std::nullopt);
  EXPECT_EQ(fetch_.onlyEnding(), nullptr);
}

TEST_F(FetchRecordsOperationTest, ARecordThatIsNotThereFailsAlone) {
  saveMany(1);
  run(operationFor({"gone", "r0"}));
  const auto deliveries = fetch_.all();
  ASSERT_EQ(deliveries.size(), 2U);
  EXPECT_TRUE(rz_isError(deliveries[0].error, RZErrorUnknownItem));
  EXPECT_EQ(deliveries[0].record, nullptr);
  EXPECT_NE(deliveries[1].record, nullptr);
  EXPECT_EQ(fetch_.onlyEnding(), nullptr);
}

TEST_F(FetchRecordsOperationTest, AMissingZoneFailsEveryRecordAndTheOperation) {
  run(operationFor({"a", "b"}, RZRecordZoneID("nowhere")));
  for (const auto& each : fetch_.all()) {
    EXPECT_TRUE(rz_isError(each.error, RZErrorZoneNotFound));
  }
  EXPECT_THAT(fetch_.names(), ElementsAre("a", "b"));
  EXPECT_TRUE(rz_isError(fetch_.onlyEnding(), RZErrorZoneNotFound));
}

TEST_F(FetchRecordsOperationTest, AStoreThatGoesAwayInTheMiddleFailsWhatIsLeft) {
  const auto names = saveMany(20);
  whenDelivered = [this](const RZRecordID& id) {
    if (id.recordName() == "r0") takeOffline();
  };
  run(operationFor(names));
  const auto deliveries = fetch_.all();
  ASSERT_EQ(fetch_.names(), names);
  EXPECT_NE(deliveries.front().record, nullptr);
  EXPECT_TRUE(rz_isError(deliveries.back().error, RZErrorNetworkUnavailable));
  EXPECT_TRUE(rz_isError(fetch_.onlyEnding(), RZErrorNetworkUnavailable));
}

TEST_F(FetchRecordsOperationTest, DoesNotAskAgainAfterAPartThatFailed) {
  const auto names = saveMany(600);
  whenDelivered = [](const RZRecordID& id) {
    if (id.recordName() == "r0") {
      EXPECT_EQ(FaultPoint::arm("rozzel.fetch.part=error"), nullptr);
    } else if (id.recordName() == "r8") {
      FaultPoint::disarmAll();
    }
  };
  run(operationFor(names));
  const auto deliveries = fetch_.all();
  ASSERT_EQ(fetch_.names(), names);
  for (std::size_t i = 0; i < deliveries.size(); ++i) {
    ASSERT_EQ(deliveries[i].record != nullptr, i < 8) << names[i];
    ASSERT_EQ(rz_isError(deliveries[i].error, RZErrorNetworkUnavailable), i >= 8) << names[i];
  }
  EXPECT_TRUE(rz_isError(fetch_.onlyEnding(), RZErrorNetworkUnavailable));
}

TEST_F(FetchRecordsOperationTest, HandsNothingOverOnceItWasCancelled) {
  const auto names = saveMany(20);
  const auto operation = operationFor(names);
  whenDelivered = [&](const RZRecordID& id) {
    if (id.recordName() == "r2") operation->cancel();
  };
  run(operation);
  EXPECT_THAT(fetch_.names(), ElementsAre("r0", "r1", "r2"));
  ASSERT_NE(fetch_.onlyEnding(), nullptr);
  EXPECT_TRUE(fetch_.onlyEnding()->is(NSCocoaErrorDomain, NSUserCancelledError));
}

TEST_F(FetchRecordsOperationTest, EndsWithTheSameErrorWhenItWasCancelledBeforeItBegan) {
  saveMany(1);
  const auto operation = operationFor({"r0"});
  operation->cancel();
  run(operation);
  EXPECT_THAT(fetch_.names(), IsEmpty());
  ASSERT_NE(fetch_.onlyEnding(), nullptr);
  EXPECT_TRUE(fetch_.onlyEnding()->is(NSCocoaErrorDomain, NSUserCancelledError));
}

TEST_F(FetchRecordsOperationTest, LetsItsHandlersGoWhenItIsFinished) {
  auto held = std::make_shared<int>(0);
  const std::weak_ptr<int> watched = held;
  const auto operation = std::make_shared<RZFetchRecordsOperation>();
  operation->setPerRecordCompletionBlock([held](const RZRecordRef&, const RZRecordID&, auto) {});
  Gate ended;
  operation->setFetchRecordsCompletionBlock([held, &ended](auto) mutable {
    held.reset();
    ended.open();
  });
  held.reset();
  store.database()->addOperation(operation);
  ASSERT_TRUE(ended.wait());
  EXPECT_TRUE(watched.expired());
}

TEST_F(FetchRecordsOperationTest, SaysThatNobodyIsSignedIn) {
  const auto database = RZContainer(store.engine(), "com.example.drive", "").privateCloudDatabase();
  database->addOperation(operationFor({"r0"}));
  ASSERT_TRUE(fetch_.ended.wait());
  EXPECT_TRUE(rz_isError(fetch_.all().at(0).error, RZErrorNotAuthenticated));
  EXPECT_TRUE(rz_isError(fetch_.onlyEnding(), RZErrorNotAuthenticated));
}

TEST_F(FetchRecordsOperationTest, AContainerIsThatOfTheSessionWhenItWasAskedFor) {
  saveMany(1);
  std::string account = "ann";
  RZContainer::setSessionSource(
      [&] { return RZContainer::Session{.engine = store.engine(), .accountName = account}; });
  const auto container = RZContainer::containerWithIdentifier("com.example.drive");
  account.clear();
  const auto nobodys = RZContainer::containerWithIdentifier("com.example.drive");
  RZContainer::setSessionSource({});
  container->setSourceApplicationBundleIdentifier("org.example.app");
  EXPECT_EQ(container->sourceApplicationBundleIdentifier(), "org.example.app");
  EXPECT_NE(fetch(container->privateCloudDatabase(), "r0"), nullptr);
  nobodys->privateCloudDatabase()->addOperation(operationFor({"r0"}));
  ASSERT_TRUE(fetch_.ended.wait());
  EXPECT_TRUE(rz_isError(fetch_.onlyEnding(), RZErrorNotAuthenticated));
}

TEST_F(FetchRecordsOperationTest, DescribesItselfWithItsGroup) {
  const auto operation = operationFor({"a"});
  operation->setGroup(std::make_shared<RZOperationGroup>("thumbnails"));
  EXPECT_THAT(operation->description(), testing::HasSubstr("of 1 records (thumbnails)"));
}

}  // namespace
}  // namespace yomber
