#include "provider/extension/size_string.h"

#include <gtest/gtest.h>

#include <clocale>
#include <limits>

namespace yomber {
namespace {

TEST(SizeString, PrintsWidthAndHeightWithTwoDecimals) {
  EXPECT_EQ(qs_stringWithSize({.width = 1024, .height = 768}), "{1024.00, 768.00}");
}

TEST(SizeString, RoundsAndKeepsTheSign) {
  EXPECT_EQ(qs_stringWithSize({.width = 0.125, .height = -2.999}), "{0.12, -3.00}");
  EXPECT_EQ(qs_stringWithSize({.width = 0, .height = -0.001}), "{0.00, -0.00}");
}

TEST(SizeString, TheLargestNumberIsPrintedWhole) {
  constexpr double kLargest = std::numeric_limits<double>::max();
  const std::string text = qs_stringWithSize({.width = -kLargest, .height = kLargest});
  // 309 digits, the point and two decimals each; one sign, the braces, the comma and the blank.
  EXPECT_EQ(text.size(), 2U * 312U + 1U + 4U);
  EXPECT_EQ(text.substr(0, 6), "{-1797");
  EXPECT_EQ(text.substr(text.size() - 4), ".00}");
}

TEST(SizeString, NumbersThatAreNoneDoNotFail) {
  EXPECT_EQ(qs_stringWithSize({.width = std::numeric_limits<double>::infinity(),
                               .height = std::numeric_limits<double>::quiet_NaN()}),
            "{inf, nan}");
}

}  // namespace
}  // namespace yomber
