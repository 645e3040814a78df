#include "platform/foundation/hexadecimal.h"

#include <gtest/gtest.h>

#include <array>
#include <string_view>

namespace yomber {
namespace {

std::string hexadecimalOf(std::string_view text) {
  return hexadecimal(std::as_bytes(std::span(text)));
}

TEST(Hexadecimal, HasTwoLowerCaseDigitsForEachByte) {
  EXPECT_EQ(hexadecimalOf("\x01\x23\x45\x67\x89\xab\xcd\xef"), "0123456789abcdef");
}

TEST(Hexadecimal, KeepsLeadingZerosAndZeroBytes) {
  constexpr std::array<unsigned char, 3> kBytes{0x00, 0x0f, 0x00};
  EXPECT_EQ(hexadecimal(std::as_bytes(std::span(kBytes))), "000f00");
}

TEST(Hexadecimal, TakesBytesOfCharactersAsUnsigned) {
  EXPECT_EQ(hexadecimalOf("\xff\x80"), "ff80");
}

TEST(Hexadecimal, IsEmptyForNothing) { EXPECT_EQ(hexadecimalOf(""), ""); }

}  // namespace
}  // namespace yomber
