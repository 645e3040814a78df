#include "provider/extension/size_string.h"

#include <array>
#include <charconv>
#include <limits>

namespace yomber {
namespace {

constexpr int kDecimals = 2;

std::string withTwoDecimals(double value) {
  // Sign, all digits before the point, the point and the decimals.
  std::array<char, std::numeric_limits<double>::max_exponent10 + kDecimals + 4> buffer{};
  const auto result = std::to_chars(buffer.data(), buffer.data() + buffer.size(), value,
                                    std::chars_format::fixed, kDecimals);
  return {buffer.data(), result.ptr};
}

}  // namespace

std::string qs_stringWithSize(const CGSize& size) {
  return "{" + withTwoDecimals(size.width) + ", " + withTwoDecimals(size.height) + "}";
}

}  // namespace yomber
