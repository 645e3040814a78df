#include "mount/wish_deadline.h"

#include <gtest/gtest.h>

namespace yomber {
namespace {

using namespace std::chrono_literals;

class WishDeadlineTest : public ::testing::Test {
 protected:
  /// A minute passes, and zarn says this.
  void look(const Downloads& downloads) {
    now_ += 1min;
    deadline_.look(last_, downloads, now_);
    last_ = downloads;
  }
  [[nodiscard]] bool isOver() const { return deadline_.isOver(now_); }

  WishDeadline::TimePoint now_;
  WishDeadline deadline_{"/a", 90s, now_};
  Downloads last_;
};

TEST_F(WishDeadlineTest, WithoutAnyBytesItComes) {
  look({});
  EXPECT_FALSE(isOver());
  look({});
  EXPECT_TRUE(isOver());
}

TEST_F(WishDeadlineTest, WhileItsBytesComeItDoesNot) {
  for (std::uint64_t done = 1; done < 9; ++done) {
    look({.running = {{"/a", {done, 10}}}});
    EXPECT_FALSE(isOver());
  }
}

TEST_F(WishDeadlineTest, WhileItIsCopiedTheBytesOfOthersDoNotCount) {
  for (std::uint64_t done = 1; done < 4; ++done) {
    look({.running = {{"/a", {5, 10}}, {"/b", {done, 10}}}});
  }
  EXPECT_TRUE(isOver());
}

TEST_F(WishDeadlineTest, WhileItWaitsForItsTurnThoseOfOthersCount) {
  for (std::uint64_t done = 1; done < 9; ++done) {
    look({.running = {{"/b", {done, 10}}}});
    EXPECT_FALSE(isOver());
  }
}

TEST_F(WishDeadlineTest, WhenItIsCopiedItWaitsForThoseCopiedWithIt) {
  for (std::uint64_t done = 1; done < 9; ++done) {
    look({.running = {{"/a", {10, 10}}, {"/b", {done, 10}}}});
    EXPECT_FALSE(isOver());
  }
}

}  // namespace
}  // namespace yomber
