#include "platform/foundation/duration_setting.h"

#include <cstdlib>

#include <gtest/gtest.h>

namespace yomber {
namespace {

using std::chrono::milliseconds;

constexpr const char* kName = "YOMBER_TEST_PAUSE_MS";

milliseconds settingOf(const char* text) {
  setenv(kName, text, 1);
  const milliseconds found = durationSetting(kName, milliseconds(500), milliseconds(1));
  unsetenv(kName);
  return found;
}

TEST(DurationSettingTest, IsTheDefaultWhereItIsNotSet) {
  unsetenv(kName);
  EXPECT_EQ(durationSetting(kName, milliseconds(500), milliseconds(1)), milliseconds(500));
}

TEST(DurationSettingTest, IsWhatIsSet) {
  EXPECT_EQ(settingOf("1"), milliseconds(1));
  EXPECT_EQ(settingOf("86400000"), milliseconds(86'400'000));
}

TEST(DurationSettingTest, IsTheDefaultWhereWhatIsSetCannotBeUsed) {
  for (const char* const text : {"", "0", "-5", "1s", "86400001", "99999999999999999999"})
    EXPECT_EQ(settingOf(text), milliseconds(500)) << text;
}

}  // namespace
}  // namespace yomber
