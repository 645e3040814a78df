#include <gtest/gtest.h>

#include <array>
#include <fstream>
#include <limits>
#include <set>
#include <string>

#include "platform/foundation/data.h"
#include "platform/foundation/date.h"
#include "platform/foundation/temporary_directory.h"
#include "platform/foundation/uuid.h"

namespace yomber {
namespace {

TEST(DataTest, CopiesNoMoreBytesThanThereAre) {
  const auto data = NSData::dataWithString("abc");
  std::array<char, 5> buffer{'-', '-', '-', '-', '-'};
  data->getBytes(buffer.data(), buffer.size());
  EXPECT_EQ(std::string(buffer.data(), 5), "abc--");
  data->getBytes(buffer.data(), 0);
  NSData::dataWithBytes(nullptr, 0)->getBytes(buffer.data(), 5);
  EXPECT_EQ(std::string(buffer.data(), 5), "abc--");
}

TEST(DataTest, IsEqualByItsBytes) {
  const auto data = NSData::dataWithString("abc");
  EXPECT_TRUE(data->isEqualToData(NSData::dataWithBytes("abcd", 3)));
  EXPECT_FALSE(data->isEqualToData(NSData::dataWithString("abd")));
  EXPECT_FALSE(data->isEqualToData(NSData::dataWithString("ab")));
  EXPECT_FALSE(data->isEqualToData(nullptr));
}

TEST(DataTest, HoldsAWholeFileThatIsNotTooLong) {
  const TemporaryDirectory directory;
  const std::string path = directory / "file";
  std::ofstream(path) << "content";
  ASSERT_NE(NSData::dataWithContentsOfFile(path, 7), nullptr);
  EXPECT_EQ(NSData::dataWithContentsOfFile(path, 7)->bytes(), "content");
  EXPECT_EQ(NSData::dataWithContentsOfFile(path, 6), nullptr);
  EXPECT_EQ(NSData::dataWithContentsOfFile(directory.path(), 100), nullptr);
  EXPECT_EQ(NSData::dataWithContentsOfFile(directory / "missing", 100), nullptr);
}

TEST(DateTest, PrintsTheFractionThatIsThere) {
  EXPECT_EQ(NSDate::fromNanoseconds(1'772'366'400'250'000'000).description(),
            "2026-03-01T12:00:00.25Z");
  EXPECT_EQ(NSDate::fromNanoseconds(1).description(), "1970-01-01T00:00:00.000000001Z");
  EXPECT_EQ(NSDate::fromNanoseconds(-1).description(), "1969-12-31T23:59:59.999999999Z");
  EXPECT_EQ(NSDate::fromNanoseconds(-1'000'000'000).description(), "1969-12-31T23:59:59Z");
}

TEST(DateTest, KeepsNanosecondsOfFileTimes) {
  EXPECT_EQ(NSDate::fromTimespec({2, 5}).nanoseconds(), 2'000'000'005);
  EXPECT_EQ(NSDate::fromTimespec({-2, 5}).nanoseconds(), -1'999'999'995);
}

TEST(DateTest, SaturatesWhereNanosecondsDoNotReach) {
  EXPECT_EQ(NSDate::fromTimespec({std::numeric_limits<std::time_t>::max(), 0}),
            NSDate::distantFuture());
  EXPECT_LT(NSDate::fromTimespec({std::numeric_limits<std::time_t>::min(), 0}),
            NSDate::fromNanoseconds(0));
  EXPECT_LT(NSDate::now(), NSDate::distantFuture());
}

TEST(UuidTest, IsFreshAndMarkedRandom) {
  std::set<UUID> seen;
  for (int i = 0; i < 1000; ++i) {
    UUID uuid{};
    uuid_generate(uuid);
    EXPECT_EQ(uuid[6] >> 4U, 4);
    EXPECT_EQ(uuid[8] >> 6U, 2);
    seen.insert(uuid);
  }
  EXPECT_EQ(seen.size(), 1000U);
}

TEST(UuidTest, ComparesByteByByte) {
  UUID left{};
  UUID right{};
  EXPECT_EQ(uuid_compare(left, right), 0);
  right[15] = 0xff;
  EXPECT_EQ(uuid_compare(left, right), -1);
  left[0] = 1;
  EXPECT_EQ(uuid_compare(left, right), 1);
  uuid_copy(right, left);
  EXPECT_EQ(uuid_compare(left, right), 0);
}

TEST(UuidTest, PrintsInGroups) {
  UUID uuid{};
  for (std::size_t i = 0; i < uuid.size(); ++i) uuid[i] = static_cast<std::uint8_t>(i * 17);
  EXPECT_EQ(uuid_unparse(uuid), "00112233-4455-6677-8899-aabbccddeeff");
}

}  // namespace
}  // namespace yomber
