#include "provider/enumeration/change_tokens.h"

#include <gtest/gtest.h>

#include <cstring>
#include <string>

namespace yomber {
namespace {

UUID freshUUID() {
  UUID uuid;
  uuid_generate(uuid);
  return uuid;
}

TEST(ChangeTokens, ATokenReadsBackItsRankWithItsOwnUUIDOnly) {
  const UUID uuid = freshUUID();
  const auto token = qs_changeTokenFromRank(7, uuid);
  EXPECT_EQ(qs_changeTokenRankWithUUID(token, uuid), 7U);
  EXPECT_EQ(qs_changeTokenRankWithUUID(token, freshUUID()), 0xFFFFFFFFFFFFFFFFU);
}

TEST(ChangeTokens, OneByteOfTheUUIDMakesTheDifference) {
  const UUID uuid = freshUUID();
  const auto token = qs_changeTokenFromRank(7, uuid);
  for (std::size_t i = 0; i < uuid.size(); ++i) {
    UUID other = uuid;
    other[i] ^= 1U;
    EXPECT_EQ(qs_changeTokenRankWithUUID(token, other), kChangeTokenOfAnotherGeneration);
  }
}

TEST(ChangeTokens, RankZeroReadsBackZeroAndIsNeverNil) {
  const UUID uuid = freshUUID();
  const auto token = qs_changeTokenFromRank(0, uuid);
  ASSERT_NE(token, nullptr);
  EXPECT_EQ(qs_changeTokenRankWithUUID(token, uuid), 0U);
}

TEST(ChangeTokens, TheRankComesFirstInNativeOrderAndThenTheRawUUID) {
  constexpr std::uint64_t kRank = 0x0102030405060708;
  const UUID uuid = freshUUID();
  const auto token = qs_changeTokenFromRank(kRank, uuid);
  ASSERT_EQ(token->length(), 24U);
  std::uint64_t rank = 0;
  std::memcpy(&rank, token->bytes().data(), sizeof(rank));
  EXPECT_EQ(rank, kRank);
  EXPECT_EQ(std::memcmp(token->bytes().data() + 8, uuid.data(), uuid.size()), 0);
}

TEST(ChangeTokens, MissingBytesReadAsZero) {
  const UUID zero{};
  EXPECT_EQ(qs_changeTokenRankWithUUID(NSData::dataWithString(""), zero), 0U);
  EXPECT_EQ(qs_changeTokenRankWithUUID(NSData::dataWithString("\x09"), zero), 9U);
  EXPECT_EQ(qs_changeTokenRankWithUUID(NSData::dataWithString(""), freshUUID()),
            kChangeTokenOfAnotherGeneration);
}

TEST(ChangeTokens, BytesBeyondTheTwentyFourthAreNotRead) {
  const UUID uuid = freshUUID();
  const std::string bytes = std::string(qs_changeTokenFromRank(3, uuid)->bytes()) + "and more";
  EXPECT_EQ(qs_changeTokenRankWithUUID(NSData::dataWithString(bytes), uuid), 3U);
}

TEST(ChangeTokens, NoTokenReadsAsRankZero) {
  EXPECT_EQ(qs_changeTokenRankWithUUID(nullptr, freshUUID()), 0U);
}

}  // namespace
}  // namespace yomber
