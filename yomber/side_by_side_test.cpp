#include "yomber/side_by_side.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <vector>

#include "platform/foundation/gate.h"

namespace yomber {
namespace {

TEST(SideBySide, DoesEachOnce) {
  for (const std::size_t width : {std::size_t{1}, std::size_t{4}, std::size_t{500}}) {
    std::vector<std::atomic<int>> done(100);
    sideBySide(done.size(), width, [&](std::size_t index) { ++done[index]; });
    EXPECT_TRUE(std::all_of(done.begin(), done.end(), [](const auto& times) { return times == 1; }))
        << width;
  }
  sideBySide(0, 4, [](std::size_t) { FAIL() << "there is nothing to do"; });
}

TEST(SideBySide, WorksOnAsManyAtATimeAsItMay) {
  Gate all;
  std::atomic<int> alone{0};
  sideBySide(4, 4, [&](std::size_t) {
    all.open();
    if (!all.wait(4)) ++alone;
  });
  EXPECT_EQ(alone, 0);
}

}  // namespace
}  // namespace yomber
