#include "zarn/change_times.h"

#include <chrono>
#include <thread>

#include "platform/foundation/fault_points.h"
#include "zarn/folder_snapshot.h"
#include "zarn/test_drive.h"

namespace yomber {
namespace {

namespace fs = std::filesystem;

TEST(SettledTime, IsOneThatTheClockHasLeftBehind) {
  EXPECT_TRUE(isSettledTime(999, 1000, 1000));
  EXPECT_TRUE(isSettledTime(999, 1000, 2000));
}

TEST(SettledTime, IsNotThatOfTheTickThatRuns) { EXPECT_FALSE(isSettledTime(1000, 1000, 1000)); }

TEST(SettledTime, IsOneFinerThanTheClock) { EXPECT_TRUE(isSettledTime(1003, 1000, 1000)); }

TEST(SettledTime, IsUnknownWhenTheClockTickedDuringTheLook) {
  EXPECT_FALSE(isSettledTime(1000, 1000, 2000));
  EXPECT_FALSE(isSettledTime(1500, 1000, 2000));
  EXPECT_FALSE(isSettledTime(2000, 1000, 2000));
}

class ChangeTimesTest : public TestDrive {
 protected:
  ~ChangeTimesTest() override { FaultPoint::disarmAll(); }

  /// Scans in another thread, and does `action` when the scan has come to the fault point.
  void scanAndAt(const std::string& point, const std::function<void()>& action) {
    const std::string go = layout.home() + "/go";
    ASSERT_EQ(FaultPoint::arm(point + "=pause-until-file:" + go), nullptr);
    std::jthread scanning([this] { scan(); });
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(60);
    while (!fs::exists(go + ".reached") && std::chrono::steady_clock::now() < deadline) {
      std::this_thread::yield();
    }
    EXPECT_TRUE(fs::exists(go + ".reached"));
    action();
    FaultPoint::disarmAll();
    std::ofstream(go).flush();
  }
};

TEST_F(ChangeTimesTest, ATagThatIsSetWhileItsFileIsStampedIsSeen) {
  scan();
  write("new.txt");
  scanAndAt("zarn.reconciler.before-stamp",
            [&] { setAttribute("new.txt", kTagsAttribute, "red"); });
  EXPECT_EQ(row("new.txt")->extra, nullptr);
  scan();
  ASSERT_NE(row("new.txt")->extra, nullptr);
  EXPECT_EQ(row("new.txt")->extra->tags, std::vector<std::string>{"red"});
}

TEST_F(ChangeTimesTest, AModeThatIsSetWhileItsFileIsStampedIsSeen) {
  scan();
  write("new.txt");
  scanAndAt("zarn.reconciler.before-stamp",
            [&] { ASSERT_EQ(chmod(at("new.txt").c_str(), 0640), 0); });
  scan();
  EXPECT_EQ(row("new.txt")->mode & 0777U, 0640U);
}

TEST_F(ChangeTimesTest, AStampedFileIsNotLookedAtAgain) {
  scan();
  write("new.txt");
  setAttribute("new.txt", kTagsAttribute, "red");
  scan();
  // A time of the tick that runs proves nothing.
  waitForTick();
  scan();
  FolderEntry entry;
  ASSERT_TRUE(lookAtEntry(AT_FDCWD, at("new.txt").c_str(), entry));
  EXPECT_EQ(row("new.txt")->ctime, entry.ctime);
}

TEST_F(ChangeTimesTest, WhatChangesInTheTickOfTheLookIsSeen) {
  scan();
  // On a disk whose times are no finer than the clock's ticks, most of these fall into one tick.
  for (unsigned mode = 0600; mode < 0700; ++mode) {
    write("file");
    ASSERT_EQ(chmod(at("file").c_str(), 0600), 0);
    scan();
    ASSERT_EQ(chmod(at("file").c_str(), mode), 0);
    scan();
    ASSERT_EQ(row("file")->mode & 0777U, mode);
  }
}

}  // namespace
}  // namespace yomber
