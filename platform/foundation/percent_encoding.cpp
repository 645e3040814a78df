#include "platform/foundation/percent_encoding.h"

namespace yomber {
namespace {

bool isLetterOrDigit(char c) {
  return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9');
}

}  // namespace

std::string percentEncoded(std::string_view text, std::string_view plain) {
  constexpr std::string_view kDigits = "0123456789ABCDEF";
  std::string result;
  result.reserve(text.size());
  for (const char c : text) {
    if (isLetterOrDigit(c) || plain.find(c) != std::string_view::npos) {
      result += c;
      continue;
    }
    const auto byte = static_cast<unsigned char>(c);
    result += '%';
    result += kDigits[byte >> 4U];
    result += kDigits[byte & 15U];
  }
  return result;
}

}  // namespace yomber
