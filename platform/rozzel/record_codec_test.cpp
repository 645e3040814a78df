#include "platform/rozzel/record_codec.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <limits>
#include <random>
#include <string>
#include <vector>

#include "platform/rozzel/byte_stream.h"
#include "platform/rozzel/store_failure.h"

namespace yomber {
namespace {

RZValues valuesOfEveryKind() {
  return {{"text", std::string(300, 't')},
          {"bytes", RZBytes{"\x01"}},
          {"integer", std::numeric_limits<std::int64_t>::min()},
          {"real", -0.25},
          {"date", NSDate::distantFuture()},
          {"texts", std::vector<std::string>{"a", "", "b"}},
          {"reference", RZReference{RZRecordID("r", RZRecordZoneID("z", "o"))}},
          {"asset", RZAsset{.hash = {1, 2, 3}, .size = std::numeric_limits<std::uint64_t>::max()}}};
}

/// True if the bytes are refused as damaged; anything but values or that refusal is a failure.
bool isRefused(std::string_view bytes) {
  const NSErrorRef error = catchingFailures([&] { (void)decodeRecordValues(bytes, std::nullopt); });
  EXPECT_TRUE(!error || rz_isError(error, RZErrorStoreDamaged));
  return error != nullptr;
}

TEST(RecordCodecTest, ReadsBackWhatItWrote) {
  const RZValues values = valuesOfEveryKind();
  EXPECT_EQ(decodeRecordValues(encodeRecordValues(values), std::nullopt), values);
  EXPECT_EQ(decodeRecordValues(encodeRecordValues({}), std::nullopt), RZValues{});
}

TEST(RecordCodecTest, RefusesBytesThatEndTooSoonOrTooLate) {
  const std::string bytes = encodeRecordValues(valuesOfEveryKind());
  for (std::size_t length = 0; length < bytes.size(); ++length) {
    EXPECT_TRUE(isRefused(bytes.substr(0, length))) << length;
  }
  EXPECT_TRUE(isRefused(bytes + '\0'));
}

TEST(RecordCodecTest, RefusesFormsAndKindsItDoesNotKnow) {
  EXPECT_TRUE(isRefused(std::string("\x02\x00", 2)));
  EXPECT_TRUE(isRefused("\x01\x01\x01k\x09"));
}

TEST(RecordCodecTest, IsNotLedAstrayByCountsAndLengths) {
  ByteSink count;
  count.addByte(1);
  count.addNumber(std::numeric_limits<std::uint64_t>::max());
  EXPECT_TRUE(isRefused(count.take()));
  ByteSink texts;
  texts.addByte(1);
  texts.addNumber(1);
  texts.addText("k");
  texts.addByte(6);
  texts.addNumber(std::numeric_limits<std::uint64_t>::max());
  EXPECT_TRUE(isRefused(texts.take()));
}

TEST(RecordCodecTest, StaysWithinWhateverBytesItIsGiven) {
  std::mt19937 random(1);
  const std::string sound = encodeRecordValues(valuesOfEveryKind());
  int refused = 0;
  for (int round = 0; round < 20'000; ++round) {
    std::string bytes = sound;
    for (unsigned flips = 1 + random() % 4; flips > 0; --flips) {
      bytes[random() % bytes.size()] = static_cast<char>(random());
    }
    // A copy of its own size, so that the address sanitizer sees a step beyond the end.
    const std::vector<char> exact(bytes.begin(), bytes.end());
    refused += isRefused({exact.data(), exact.size()}) ? 1 : 0;
  }
  EXPECT_GT(refused, 1000);
}

TEST(ByteStreamTest, ReadsNumbersOfEverySizeBack) {
  for (unsigned shift = 0; shift < 64; ++shift) {
    const std::uint64_t number = std::numeric_limits<std::uint64_t>::max() >> shift;
    ByteSink sink;
    sink.addNumber(number);
    sink.addFixed(number);
    const std::string bytes = sink.take();
    ByteSource source(bytes);
    EXPECT_EQ(source.number(), number);
    EXPECT_EQ(source.fixed(), number);
    EXPECT_TRUE(source.finished());
  }
}

TEST(ByteStreamTest, RefusesANumberThatDoesNotFit) {
  const std::string large = std::string(9, '\xff') + "\x02";
  ByteSource tooLarge(large);
  EXPECT_EQ(tooLarge.number(), 0U);
  EXPECT_FALSE(tooLarge.good());
  const std::string longer = std::string(10, '\xff') + "\x01";
  ByteSource endless(longer);
  EXPECT_EQ(endless.number(), 0U);
  EXPECT_FALSE(endless.good());
}

}  // namespace
}  // namespace yomber
