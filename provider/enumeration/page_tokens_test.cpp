#include "provider/enumeration/page_tokens.h"

#include <gtest/gtest.h>

#include <cstring>
#include <limits>
#include <string>

#include "platform/fileprovider/constants.h"

namespace yomber {
namespace {

constexpr std::size_t kPageTokenLength = 16;

NSDataRef pageOf(std::string bytes) { return NSData::dataWithString(bytes); }

TEST(PageTokens, TheInitialPageByDateIsDateOrderFromTheBeginning) {
  EXPECT_EQ(qs_pageTokenSortOrder(NSFileProviderInitialPageSortedByDate), 1U);
  EXPECT_EQ(qs_pageTokenOffset(NSFileProviderInitialPageSortedByDate), 0U);
}

TEST(PageTokens, TheInitialPageByNameIsNameOrderFromTheBeginning) {
  EXPECT_EQ(qs_pageTokenSortOrder(NSFileProviderInitialPageSortedByName), 0U);
  EXPECT_EQ(qs_pageTokenOffset(NSFileProviderInitialPageSortedByName), 0U);
}

TEST(PageTokens, InitialPagesAreKnownByTheirBytesNotByTheirObject) {
  const auto copy = pageOf(std::string(NSFileProviderInitialPageSortedByDate->bytes()));
  EXPECT_EQ(qs_pageTokenSortOrder(copy), 1U);
  EXPECT_EQ(qs_pageTokenOffset(copy), 0U);
}

TEST(PageTokens, OffsetZeroHasNoTokenWhateverTheSortOrder) {
  EXPECT_EQ(qs_pageTokenFromSortOrder(0, 0), nullptr);
  EXPECT_EQ(qs_pageTokenFromSortOrder(1, 0), nullptr);
  EXPECT_EQ(qs_pageTokenFromSortOrder(255, 0), nullptr);
}

TEST(PageTokens, OffsetOneHasATokenOfSixteenBytes) {
  const auto token = qs_pageTokenFromSortOrder(1, 1);
  ASSERT_NE(token, nullptr);
  EXPECT_EQ(token->length(), kPageTokenLength);
}

TEST(PageTokens, TheOffsetComesFirstInNativeOrderAndThenTheSortOrder) {
  constexpr std::uint64_t kOffset = 0x1122334455667788;
  const auto token = qs_pageTokenFromSortOrder(1, kOffset);
  std::uint64_t offset = 0;
  std::memcpy(&offset, token->bytes().data(), sizeof(offset));
  EXPECT_EQ(offset, kOffset);
  EXPECT_EQ(token->bytes()[8], '\1');
}

TEST(PageTokens, ATokenReadsBackWhatItWasBuiltFrom) {
  for (const std::uint64_t sortOrder : {0, 1}) {
    for (const std::uint64_t offset :
         {std::uint64_t{1}, std::uint64_t{200}, std::numeric_limits<std::uint64_t>::max()}) {
      const auto token = qs_pageTokenFromSortOrder(sortOrder, offset);
      EXPECT_EQ(qs_pageTokenSortOrder(token), sortOrder);
      EXPECT_EQ(qs_pageTokenOffset(token), offset);
    }
  }
}

TEST(PageTokens, OnlyEightBitsOfTheSortOrderAreKept) {
  EXPECT_EQ(qs_pageTokenSortOrder(qs_pageTokenFromSortOrder(0x1f1, 5)), 0xf1U);
}

TEST(PageTokens, TheReservedBytesAreNeverRead) {
  std::string bytes(qs_pageTokenFromSortOrder(1, 200)->bytes());
  bytes.replace(9, 7, 7, '\xff');
  EXPECT_EQ(qs_pageTokenSortOrder(pageOf(bytes)), 1U);
  EXPECT_EQ(qs_pageTokenOffset(pageOf(bytes)), 200U);
}

TEST(PageTokens, MissingBytesReadAsZero) {
  EXPECT_EQ(qs_pageTokenOffset(pageOf("")), 0U);
  EXPECT_EQ(qs_pageTokenSortOrder(pageOf("")), 0U);
  EXPECT_EQ(qs_pageTokenOffset(pageOf(std::string("\x05\0\0", 3))), 5U);
  EXPECT_EQ(qs_pageTokenSortOrder(pageOf(std::string(8, '\xff'))), 0U);
}

TEST(PageTokens, BytesBeyondTheSixteenthAreNotRead) {
  const std::string bytes = std::string(qs_pageTokenFromSortOrder(1, 7)->bytes()) + "and more";
  EXPECT_EQ(qs_pageTokenOffset(pageOf(bytes)), 7U);
  EXPECT_EQ(qs_pageTokenSortOrder(pageOf(bytes)), 1U);
}

TEST(PageTokens, NoPageReadsAsNameOrderFromTheBeginning) {
  EXPECT_EQ(qs_pageTokenSortOrder(nullptr), 0U);
  EXPECT_EQ(qs_pageTokenOffset(nullptr), 0U);
}

}  // namespace
}  // namespace yomber
