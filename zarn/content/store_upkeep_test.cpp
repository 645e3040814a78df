#include "zarn/content/store_upkeep.h"

#include "zarn/content/test_content.h"

namespace yomber {
namespace {

constexpr std::int64_t kHour = 3'600'000'000'000;

class StoreUpkeepTest : public ContentDrive {
 protected:
  StoreUpkeepTest() : now_(NSDate::now().nanoseconds()) {
    EmbeddedEngineOptions later;
    later.clock = [this] { return NSDate::fromNanoseconds(now_); };
    store_ = std::make_shared<EmbeddedEngine>(storePath, later);
  }
  StoreUpkeep upkeep() {
    StoreUpkeep::Options given;
    given.clock = [this] { return now_; };
    return {store_, database, [this] { return isIdle_; }, given};
  }

  std::int64_t now_;
  bool isIdle_ = true;
  std::shared_ptr<EmbeddedEngine> store_;
};

TEST_F(StoreUpkeepTest, DropsContentThatNobodyHasReferredToForAMonth) {
  write("kept", "of ann");
  write("edited", "first");
  write("removed", "gone");
  settle();
  write("edited", "second");
  remove("removed");
  settle();
  ASSERT_EQ(evict("kept"), nullptr);
  ASSERT_EQ(assetFiles().size(), 4U);
  now_ += 29 * 24 * kHour;
  EXPECT_TRUE(upkeep().runIfDue());
  EXPECT_EQ(assetFiles().size(), 4U) << "the grace is 30 days";
  now_ += 2 * 24 * kHour;
  EXPECT_TRUE(upkeep().runIfDue());
  EXPECT_EQ(assetFiles().size(), 2U);
  EXPECT_EQ(provide("kept"), nullptr);
  EXPECT_EQ(contentInStore(id("edited")), "second");
}

TEST_F(StoreUpkeepTest, IsDoneOnceADayWhoeverAsks) {
  EXPECT_TRUE(upkeep().runIfDue());
  EXPECT_FALSE(upkeep().runIfDue());
  now_ += 23 * kHour;
  EXPECT_FALSE(upkeep().runIfDue());
  now_ += kHour;
  EXPECT_TRUE(upkeep().runIfDue());
  now_ -= 1000 * kHour;  // somebody has put the clock right
  EXPECT_TRUE(upkeep().runIfDue());
}

TEST_F(StoreUpkeepTest, WaitsForJobsButNotForEver) {
  EXPECT_TRUE(upkeep().runIfDue());
  isIdle_ = false;
  now_ += 30 * kHour;
  EXPECT_FALSE(upkeep().runIfDue());
  now_ += 20 * kHour;
  EXPECT_TRUE(upkeep().runIfDue());
}

TEST_F(StoreUpkeepTest, IsTriedAgainWhenTheStoreIsBack) {
  goOffline();
  EXPECT_FALSE(upkeep().runIfDue());
  comeBack();
  EXPECT_TRUE(upkeep().runIfDue());
}

}  // namespace
}  // namespace yomber
