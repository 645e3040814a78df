#include "platform/ostrell/file_object_id.h"

#include <charconv>
#include <limits>
#include <optional>

namespace yomber {
namespace {

constexpr std::uint64_t kLargestRawID = std::numeric_limits<std::int64_t>::max();

std::optional<QSFileObjectID::Kind> kindOfLetter(char letter) {
  switch (letter) {
    case 'd':
      return QSFileObjectID::Kind::Document;
    case 'i':
      return QSFileObjectID::Kind::Folder;
    case 'a':
      return QSFileObjectID::Kind::Alias;
    default:
      return std::nullopt;
  }
}

char letterOfKind(QSFileObjectID::Kind kind) {
  switch (kind) {
    case QSFileObjectID::Kind::Folder:
      return 'i';
    case QSFileObjectID::Kind::Alias:
      return 'a';
    case QSFileObjectID::Kind::Document:
      break;
  }
  return 'd';
}

}  // namespace

QSFileObjectIDRef QSFileObjectID::fileObjectIDWithString(std::string_view string) {
  if (string.size() < 3 || string[1] != ':') return nullptr;
  const auto kind = kindOfLetter(string[0]);
  const std::string_view digits = string.substr(2);
  // A leading zero is either zero or a form that is never printed.
  if (!kind || digits[0] < '1' || digits[0] > '9') return nullptr;
  std::uint64_t rawID = 0;
  const char* const begin = &digits.front();
  const char* const end = begin + digits.size();
  const auto [parsed, failure] = std::from_chars(begin, end, rawID);
  if (failure != std::errc() || parsed != end || rawID > kLargestRawID) return nullptr;
  return std::make_shared<QSFileObjectID>(*kind, rawID);
}

std::string QSFileObjectID::asString() const {
  return std::string{letterOfKind(kind_), ':'} + std::to_string(rawID_);
}

}  // namespace yomber
