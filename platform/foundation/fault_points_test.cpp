#include "platform/foundation/fault_points.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <thread>

namespace yomber {
namespace {

class FaultPointsTest : public testing::Test {
 protected:
  ~FaultPointsTest() override { FaultPoint::disarmAll(); }
};

TEST_F(FaultPointsTest, DoesNothingWhileNotArmed) {
  FaultPoint point("test.idle");
  EXPECT_FALSE(point.hit());
}

TEST_F(FaultPointsTest, ArmsPointsThatExistAndThoseThatComeLater) {
  FaultPoint early("test.early");
  ASSERT_EQ(FaultPoint::arm("test.early=error,test.late=error"), nullptr);
  FaultPoint late("test.late");
  FaultPoint other("test.other");
  EXPECT_TRUE(early.hit());
  EXPECT_TRUE(late.hit());
  EXPECT_FALSE(other.hit());
  FaultPoint::disarmAll();
  EXPECT_FALSE(early.hit());
}

TEST_F(FaultPointsTest, RefusesMalformedTextAndArmsNothing) {
  FaultPoint point("test.a");
  for (const char* bad :
       {"test.a", "=error", "test.a=error,test.b", "test.a=explode", "test.a=pause-until-file:"}) {
    EXPECT_NE(FaultPoint::arm(bad), nullptr) << bad;
    EXPECT_FALSE(point.hit()) << bad;
  }
}

TEST_F(FaultPointsTest, PausesUntilTheFileExists) {
  char directory[] = "/tmp/yomber-fault-points-XXXXXX";
  ASSERT_NE(mkdtemp(directory), nullptr);
  const std::string go = std::string(directory) + "/go";
  FaultPoint point("test.pause");
  ASSERT_EQ(FaultPoint::arm("test.pause=pause-until-file:" + go), nullptr);
  std::atomic<bool> passed{false};
  std::thread thread([&] {
    EXPECT_FALSE(point.hit());
    passed = true;
  });
  while (!std::filesystem::exists(go + ".reached")) std::this_thread::yield();
  EXPECT_FALSE(passed);
  std::ofstream(go).put('x');
  thread.join();
  EXPECT_TRUE(passed);
  std::filesystem::remove_all(directory);
}

TEST_F(FaultPointsTest, PausesEachTimeUntilTheFileExists) {
  char directory[] = "/tmp/yomber-fault-points-XXXXXX";
  ASSERT_NE(mkdtemp(directory), nullptr);
  const std::string go = std::string(directory) + "/go";
  FaultPoint point("test.pause");
  ASSERT_EQ(FaultPoint::arm("test.pause=pause-each-until-file:" + go), nullptr);
  std::atomic<int> passed{0};
  std::thread thread([&] {
    for (int time = 0; time < 3; ++time) {
      EXPECT_FALSE(point.hit());
      ++passed;
    }
  });
  for (int time = 0; time < 3; ++time) {
    while (!std::filesystem::exists(go + ".reached")) std::this_thread::yield();
    EXPECT_EQ(passed, time);
    std::ofstream(go).put('x');
    while (std::filesystem::exists(go)) std::this_thread::yield();
  }
  thread.join();
  EXPECT_EQ(passed, 3);
  std::filesystem::remove_all(directory);
}

TEST_F(FaultPointsTest, AbortsTheProcess) {
  FaultPoint point("test.abort");
  ASSERT_EQ(FaultPoint::arm("test.abort=abort"), nullptr);
  EXPECT_DEATH((void)point.hit(), "");
}

}  // namespace
}  // namespace yomber
