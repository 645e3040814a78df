#include "platform/foundation/bounced_name.h"

namespace yomber {
namespace {

/// Where the extension begins, its dot included; a leading dot begins none.
std::size_t extensionBegin(std::string_view name) {
  constexpr std::size_t kLongestExtension = 16;
  const std::size_t dot = name.rfind('.');
  if (dot == std::string_view::npos || dot == 0) return name.size();
  if (dot + 1 == name.size() || name.size() - dot > kLongestExtension) return name.size();
  return name.find(' ', dot) == std::string_view::npos ? dot : name.size();
}

std::string_view cutToBytes(std::string_view text, std::size_t length) {
  if (text.size() <= length) return text;
  while (length > 0 && (static_cast<unsigned char>(text[length]) & 0xC0U) == 0x80U) --length;
  return text.substr(0, length);
}

}  // namespace

std::string bouncedName(std::string_view name,
                        const std::function<bool(const std::string&)>& isTaken,
                        std::size_t maximumLength, std::uint64_t firstNumber) {
  const std::size_t dot = extensionBegin(name);
  const std::string_view extension = name.substr(dot);
  std::string candidate(name);
  if (name.size() > maximumLength) {
    candidate = cutToBytes(name.substr(0, dot), maximumLength - extension.size());
    candidate.append(extension);
  }
  for (std::uint64_t number = firstNumber; isTaken(candidate); ++number) {
    const std::string suffix = " " + std::to_string(number);
    const std::size_t room = maximumLength - suffix.size() - extension.size();
    candidate = cutToBytes(name.substr(0, dot), room);
    candidate.append(suffix).append(extension);
  }
  return candidate;
}

}  // namespace yomber
