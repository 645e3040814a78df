#include "platform/ostrell/fault_record.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <charconv>
#include <span>
#include <utility>
#include <vector>

#include "platform/foundation/fault_attributes.h"
#include "platform/foundation/hexadecimal.h"

namespace yomber {
namespace {

constexpr std::string_view kVersion = "1";
constexpr std::size_t kFields = 8;
constexpr std::size_t kLongestRecord = 2048;
constexpr const char* kNothing = "-";

std::string toHex(std::string_view bytes) {
  return bytes.empty() ? kNothing : hexadecimal(std::as_bytes(std::span(bytes)));
}

std::optional<std::string> fromHex(std::string_view text) {
  if (text == kNothing) return std::string();
  if (text.size() % 2 != 0) return std::nullopt;
  std::string result;
  for (std::size_t i = 0; i < text.size(); i += 2) {
    unsigned value = 0;
    const char* const end = text.data() + i + 2;
    const auto [rest, failure] = std::from_chars(text.data() + i, end, value, 16);
    if (failure != std::errc() || rest != end) return std::nullopt;
    result += static_cast<char>(value);
  }
  return result;
}

template <typename Number>
bool toNumber(std::string_view text, Number& number) {
  const char* const end = text.data() + text.size();
  const auto [rest, failure] = std::from_chars(text.data(), end, number);
  return failure == std::errc() && rest == end;
}

std::vector<std::string_view> fieldsOf(std::string_view text) {
  std::vector<std::string_view> fields;
  while (!text.empty() && fields.size() <= kFields) {
    const auto space = text.find(' ');
    fields.push_back(text.substr(0, space));
    text.remove_prefix(space == std::string_view::npos ? text.size() : space + 1);
  }
  return fields;
}

}  // namespace

std::string FaultRecord::encoded() const {
  std::string text(kVersion);
  for (const std::string& field :
       {std::to_string(item), std::to_string(content.size), content.hexHash(),
        std::to_string(mtime), std::to_string(head), toHex(tag), toHex(account)}) {
    text += ' ';
    text += field;
  }
  return text;
}

std::optional<FaultRecord> FaultRecord::decode(std::string_view text) {
  const auto fields = fieldsOf(text);
  if (fields.size() != kFields || fields[0] != kVersion) return std::nullopt;
  FaultRecord record;
  std::uint64_t size = 0;
  if (!toNumber(fields[1], record.item) || !toNumber(fields[2], size) ||
      !toNumber(fields[4], record.mtime) || !toNumber(fields[5], record.head)) {
    return std::nullopt;
  }
  const auto content = RZAsset::fromHexHash(fields[3], size);
  auto tag = fromHex(fields[6]);
  auto account = fromHex(fields[7]);
  if (!content || !tag || !account) return std::nullopt;
  record.content = *content;
  record.tag = std::move(*tag);
  record.account = std::move(*account);
  return record;
}

std::optional<FaultRecord> readFaultRecord(int file, bool& isDamaged) {
  std::array<char, kLongestRecord> text{};
  const ssize_t length = readAttribute(file, kFaultAttribute, text.data(), text.size());
  isDamaged = false;
  if (length < 0 && errno != ERANGE) return std::nullopt;
  auto record = FaultRecord::decode(
      std::string_view(text.data(), static_cast<std::size_t>(std::max<ssize_t>(length, 0))));
  isDamaged = !record;
  return record;
}

std::uint64_t headChecksum(std::string_view bytes) {
  // FNV-1a: somebody's writing is to be noticed, nobody's ill will.
  std::uint64_t sum = 0xcbf29ce484222325ULL;
  for (const char byte : bytes) {
    sum ^= static_cast<unsigned char>(byte);
    sum *= 0x100000001b3ULL;
  }
  return sum;
}

}  // namespace yomber
