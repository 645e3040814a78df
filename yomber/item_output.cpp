#include "yomber/item_output.h"

#include <array>
#include <cstdio>
#include <ctime>

#include <openssl/evp.h>
#include <unicode/utf8.h>
#include <nlohmann/json.hpp>

#include "platform/fileprovider/item_kind_name.h"
#include "platform/foundation/file_time.h"
#include "protocols/common.capnp.h"
#include "yomber/failure_text.h"

namespace yomber {

namespace {

#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wconversion"  // within ICU's macro
/// The code point at `index`, which moves past it; negative when the bytes are no UTF-8.
UChar32 nextCodePoint(const std::string& bytes, std::int32_t& index) {
  UChar32 point = 0;
  const auto length = static_cast<std::int32_t>(bytes.size());
  U8_NEXT(bytes.data(), index, length, point);
  return point;
}
#pragma GCC diagnostic pop

bool isUtf8(const std::string& bytes) {
  for (std::int32_t index = 0; index < static_cast<std::int32_t>(bytes.size());) {
    if (nextCodePoint(bytes, index) < 0) return false;
  }
  return true;
}

std::string base64(const std::string& bytes) {
  std::string encoded(4 * ((bytes.size() + 2) / 3) + 1, '\0');
  const int length = EVP_EncodeBlock(reinterpret_cast<unsigned char*>(encoded.data()),
                                     reinterpret_cast<const unsigned char*>(bytes.data()),
                                     static_cast<int>(bytes.size()));
  encoded.resize(static_cast<std::size_t>(length));
  return encoded;
}

void appendEscaped(std::string& out, unsigned char byte) {
  std::array<char, 5> text{};
  std::snprintf(text.data(), text.size(), "\\x%02x", byte);
  out += text.data();
}

std::string localTime(NSDate date) {
  const std::time_t seconds = timespecOf(date.nanoseconds()).tv_sec;
  std::tm parts{};
  localtime_r(&seconds, &parts);
  std::array<char, 32> text{};
  std::strftime(text.data(), text.size(), "%Y-%m-%d %H:%M:%S", &parts);
  return text.data();
}

std::string longLine(const ItemFields& item) {
  std::array<char, 96> head{};
  std::snprintf(head.data(), head.size(), "%-8s  %9s  %s  ", itemKindName(item.kind),
                item.kind == ItemKind::Folder ? "-" : readableSize(item.size).c_str(),
                localTime(item.modificationDate).c_str());
  std::string line = head.data();
  line += item.identifier;
  if (item.identifier.size() < 22) line.append(22 - item.identifier.size(), ' ');
  line += "  " + printableName(item.filename);
  for (const std::string& tag : item.tags) line += " #" + printableName(tag);
  return line;
}

}  // namespace

std::string printableName(const std::string& name) {
  std::string out;
  for (std::int32_t index = 0; index < static_cast<std::int32_t>(name.size());) {
    const std::int32_t start = index;
    const UChar32 point = nextCodePoint(name, index);
    const bool control = point < 0x20 || (point >= 0x7f && point < 0xa0);
    for (std::int32_t at = start; at < index; ++at) {
      const auto byte = static_cast<unsigned char>(name[static_cast<std::size_t>(at)]);
      if (control) {
        appendEscaped(out, byte);
      } else {
        out += static_cast<char>(byte);
      }
    }
  }
  return out;
}

std::string readableSize(std::uint64_t bytes) {
  constexpr std::array<const char*, 7> units{"B", "KB", "MB", "GB", "TB", "PB", "EB"};
  auto value = static_cast<double>(bytes);
  std::size_t unit = 0;
  while (value >= 999.5 && unit + 1 < units.size()) {
    value /= 1000;
    ++unit;
  }
  std::array<char, 32> text{};
  std::snprintf(text.data(), text.size(), unit == 0 || value >= 9.95 ? "%.0f %s" : "%.1f %s", value,
                units[unit]);
  return text.data();
}

nlohmann::ordered_json itemJson(const ItemFields& item) {
  nlohmann::ordered_json json;
  json["id"] = item.identifier;
  json["parent"] = item.parentIdentifier;
  if (isUtf8(item.filename)) {
    json["name"] = item.filename;
  } else {
    json["name_base64"] = base64(item.filename);
  }
  json["kind"] = itemKindName(item.kind);
  json["type"] = item.contentType;
  json["size"] = item.size;
  json["created"] = item.creationDate.description();
  json["modified"] = item.modificationDate.description();
  if (item.lastUsedDate) json["last_used"] = item.lastUsedDate->description();
  if (item.favoriteRank) json["favorite_rank"] = *item.favoriteRank;
  json["tags"] = item.tags;
  json["downloaded"] = (item.flags & protocol::ITEM_FLAG_DOWNLOADED) != 0;
  json["uploaded"] = (item.flags & protocol::ITEM_FLAG_UPLOADED) != 0;
  json["shared"] = (item.flags & protocol::ITEM_FLAG_SHARED) != 0;
  json["trashed"] = (item.flags & protocol::ITEM_FLAG_TRASHED) != 0;
  if (!item.containerID.empty()) json["container"] = item.containerID;
  return json;
}

nlohmann::ordered_json errorJson(const NSErrorRef& error) {
  nlohmann::ordered_json json;
  json["domain"] = error->domain();
  json["code"] = error->code();
  json["message"] = failureText(error);
  return json;
}

std::string jsonLine(const nlohmann::ordered_json& json) {
  return json.dump(-1, ' ', false, nlohmann::json::error_handler_t::replace);
}

std::string itemLine(const ItemFields& item, OutputForm form) {
  switch (form) {
    case OutputForm::Short:
      return printableName(item.filename) + (item.kind == ItemKind::Folder ? "/" : "");
    case OutputForm::Long:
      return longLine(item);
    case OutputForm::Json:
      return jsonLine(itemJson(item));
  }
  return {};
}

}  // namespace yomber
