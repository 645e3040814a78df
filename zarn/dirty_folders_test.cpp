#include "zarn/dirty_folders.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

namespace yomber {
namespace {

using testing::ElementsAre;
using testing::IsEmpty;
using Clock = DirtyFolders::Clock;
using std::chrono::milliseconds;

const Clock::time_point kNow = Clock::time_point(std::chrono::hours(1));

class DirtyFoldersTest : public testing::Test {
 protected:
  DirtyFolders dirty_{milliseconds(300)};
};

TEST_F(DirtyFoldersTest, NamesAreTakenOnceEach) {
  EXPECT_FALSE(dirty_.dueTime());
  dirty_.noteName(7, "b");
  dirty_.noteName(7, "a");
  dirty_.noteName(7, "b");
  EXPECT_LE(dirty_.dueTime(), kNow);
  const auto taken = dirty_.take(kNow);
  ASSERT_EQ(taken.size(), 1U);
  EXPECT_EQ(taken[0].id, 7U);
  EXPECT_THAT(taken[0].names, ElementsAre("a", "b"));
  EXPECT_FALSE(dirty_.dueTime());
  EXPECT_THAT(dirty_.take(kNow), IsEmpty());
}

TEST_F(DirtyFoldersTest, AWholeFolderNeedsNoNames) {
  dirty_.noteName(7, "a");
  dirty_.noteWhole(7);
  dirty_.noteName(7, "b");
  const auto taken = dirty_.take(kNow);
  ASSERT_EQ(taken.size(), 1U);
  EXPECT_TRUE(taken[0].isWhole);
  EXPECT_THAT(taken[0].names, IsEmpty());
}

TEST_F(DirtyFoldersTest, TooManyNamesAreTheWholeFolder) {
  for (int i = 0; i <= 32768; ++i) dirty_.noteName(7, std::to_string(i));
  const auto taken = dirty_.take(kNow);
  ASSERT_EQ(taken.size(), 1U);
  EXPECT_TRUE(taken[0].isWhole);
}

TEST_F(DirtyFoldersTest, OneEndOfAMoveWaitsAMomentForTheOther) {
  dirty_.noteMovedFrom(1, kNow);
  dirty_.noteName(7, "a");
  ASSERT_TRUE(dirty_.dueTime());
  EXPECT_GT(*dirty_.dueTime(), kNow);
  EXPECT_LE(*dirty_.dueTime(), kNow + milliseconds(5));
  dirty_.noteMovedTo(1);
  dirty_.noteName(8, "a");
  EXPECT_LE(*dirty_.dueTime(), kNow);
  EXPECT_EQ(dirty_.take(kNow).size(), 2U);
}

TEST_F(DirtyFoldersTest, AMoveOutOfTheTreeHoldsUpNothingForLong) {
  dirty_.noteMovedFrom(1, kNow);
  dirty_.noteName(7, "a");
  const auto later = *dirty_.dueTime();
  EXPECT_EQ(dirty_.take(later).size(), 1U);
  dirty_.noteName(7, "b");
  EXPECT_LE(*dirty_.dueTime(), later);
}

TEST_F(DirtyFoldersTest, AFileThatIsBeingWrittenWaitsLonger) {
  dirty_.noteModify(7, "a", kNow);
  dirty_.noteModify(7, "a", kNow + milliseconds(200));
  EXPECT_EQ(*dirty_.dueTime(), kNow + milliseconds(300));
  EXPECT_THAT(dirty_.take(kNow + milliseconds(299)), IsEmpty());
  EXPECT_EQ(dirty_.take(kNow + milliseconds(300)).size(), 1U);
  EXPECT_FALSE(dirty_.dueTime());
}

TEST_F(DirtyFoldersTest, AFolderThatIsGoneIsForgotten) {
  dirty_.noteName(7, "a");
  dirty_.forget(7);
  EXPECT_FALSE(dirty_.dueTime());
}

}  // namespace
}  // namespace yomber
