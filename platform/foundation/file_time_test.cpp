#include "platform/foundation/file_time.h"

#include <gtest/gtest.h>

#include <limits>

namespace yomber {
namespace {

constexpr std::int64_t kYear2400 = 13'569'465'600;
constexpr std::int64_t kYear1600 = -11'676'096'000;

TEST(FileTime, NanosecondsAndBack) {
  for (const std::timespec time : {std::timespec{0, 0}, {1, 5}, {-1, 5}, {-2, 999'999'999}}) {
    const std::int64_t value = nanosecondsOf(time);
    const std::timespec back = timespecOf(value);
    EXPECT_EQ(back.tv_sec, time.tv_sec) << value;
    EXPECT_EQ(back.tv_nsec, time.tv_nsec) << value;
  }
  EXPECT_EQ(nanosecondsOf(-1, 5), -999'999'995);
}

TEST(FileTime, WhatIsTooFarAwayIsTheNearestDateAndKeepsItsSign) {
  EXPECT_EQ(nanosecondsOf(kYear2400, 0), kLatestFileTime);
  EXPECT_EQ(nanosecondsOf(kYear1600, 0), kEarliestFileTime);
  EXPECT_EQ(nanosecondsOf(std::numeric_limits<std::int64_t>::max(), 999'999'999), kLatestFileTime);
  EXPECT_EQ(nanosecondsOf(std::numeric_limits<std::int64_t>::min(), 0), kEarliestFileTime);
  // The last second that 64 bits hold, and its first nanosecond that they do not.
  EXPECT_EQ(nanosecondsOf(9'223'372'036, 854'775'806), kLatestFileTime - 1);
  EXPECT_EQ(nanosecondsOf(9'223'372'036, 854'775'808), kLatestFileTime);
}

TEST(FileTime, TheEndsCanBeNegatedAndStored) {
  EXPECT_EQ(-kEarliestFileTime, kLatestFileTime);
  for (const std::int64_t end : {kEarliestFileTime, kLatestFileTime}) {
    EXPECT_EQ(nanosecondsOf(timespecOf(end)), end);
  }
}

}  // namespace
}  // namespace yomber
