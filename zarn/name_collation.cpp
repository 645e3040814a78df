#include "zarn/name_collation.h"

#include <unicode/ucol.h>
#include <unicode/unorm2.h>
#include <unicode/ustring.h>

#include <algorithm>
#include <array>
#include <cstdint>
#include <optional>
#include <stdexcept>

namespace yomber {
namespace {

constexpr UChar32 kReplacement = 0xFFFD;
/// Raised when the layout of keys changes here.
constexpr const char* kKeyLayout = "1";

UCollator* openCollator() {
  UErrorCode status = U_ZERO_ERROR;
  UCollator* collator = ucol_open("root", &status);
  ucol_setAttribute(collator, UCOL_NUMERIC_COLLATION, UCOL_ON, &status);
  ucol_setAttribute(collator, UCOL_NORMALIZATION_MODE, UCOL_ON, &status);
  ucol_setAttribute(collator, UCOL_STRENGTH, UCOL_TERTIARY, &status);
  if (U_FAILURE(status)) throw std::runtime_error("ICU's collation data cannot be loaded");
  return collator;
}

const UCollator* collator() {
  static const UCollator* const shared = openCollator();
  return shared;
}

/// The name as UTF-16, in `buffer` when it fits.
class Utf16 {
 public:
  explicit Utf16(std::string_view name) {
    if (name.size() > buffer_.size()) heap_.resize(name.size());
    UChar* const out = heap_.empty() ? buffer_.data() : heap_.data();
    const bool isAscii = std::all_of(name.begin(), name.end(),
                                     [](char c) { return static_cast<unsigned char>(c) < 0x80; });
    if (isAscii) {
      std::transform(name.begin(), name.end(), out, [](char c) { return static_cast<UChar>(c); });
      length_ = static_cast<std::int32_t>(name.size());
      return;
    }
    UErrorCode status = U_ZERO_ERROR;
    // Never longer in UTF-16 units than in UTF-8 bytes, replacements included.
    u_strFromUTF8WithSub(out, static_cast<std::int32_t>(name.size()), &length_, name.data(),
                         static_cast<std::int32_t>(name.size()), kReplacement, &replaced_, &status);
    if (U_FAILURE(status)) length_ = 0;
  }

  [[nodiscard]] const UChar* data() const { return heap_.empty() ? buffer_.data() : heap_.data(); }
  [[nodiscard]] std::int32_t length() const { return length_; }
  [[nodiscard]] bool isFaithful() const { return replaced_ == 0; }

 private:
  std::array<UChar, 512> buffer_;
  std::u16string heap_;
  std::int32_t length_ = 0;
  std::int32_t replaced_ = 0;
};

std::optional<std::u16string> normalized(std::string_view name) {
  const Utf16 text(name);
  if (!text.isFaithful()) return std::nullopt;
  UErrorCode status = U_ZERO_ERROR;
  const UNormalizer2* const nfc = unorm2_getNFCInstance(&status);
  std::u16string result(static_cast<std::size_t>(text.length()) * 3 + 8, u'\0');
  const std::int32_t length = unorm2_normalize(nfc, text.data(), text.length(), result.data(),
                                               static_cast<std::int32_t>(result.size()), &status);
  if (U_FAILURE(status)) return std::nullopt;
  result.resize(static_cast<std::size_t>(length));
  return result;
}

}  // namespace

void appendNameSortKey(std::string& out, std::string_view name) {
  const Utf16 text(name);
  const std::size_t begin = out.size();
  std::size_t room = name.size() * 4 + 32;
  for (;;) {
    out.resize(begin + room);
    const auto needed = static_cast<std::size_t>(ucol_getSortKey(
        collator(), text.data(), text.length(), reinterpret_cast<std::uint8_t*>(out.data() + begin),
        static_cast<std::int32_t>(room)));
    if (needed <= room) {
      out.resize(begin + needed);
      break;
    }
    room = needed;
  }
  out.append(name);
}

std::string nameSortKey(std::string_view name) {
  std::string key;
  appendNameSortKey(key, name);
  return key;
}

std::string_view sortKeyCollationPart(std::string_view key) {
  const std::size_t end = key.find('\0');
  return key.substr(0, end == std::string_view::npos ? key.size() : end + 1);
}

const std::string& nameCollationVersion() {
  static const std::string version = [] {
    UVersionInfo info;
    ucol_getVersion(collator(), info);
    std::array<char, U_MAX_VERSION_STRING_LENGTH> text{};
    u_versionToString(info, text.data());
    return std::string(kKeyLayout) + "/" + text.data();
  }();
  return version;
}

bool areNormalizationTwins(std::string_view left, std::string_view right) {
  if (left == right) return true;
  const auto leftText = normalized(left);
  const auto rightText = normalized(right);
  return leftText && rightText && *leftText == *rightText;
}

}  // namespace yomber
