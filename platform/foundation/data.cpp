#include "platform/foundation/data.h"

#include <algorithm>
#include <cstring>

namespace yomber {

NSDataRef NSData::dataWithBytes(const void* bytes, std::size_t length) {
  return std::make_shared<const NSData>(std::string(static_cast<const char*>(bytes), length));
}

NSDataRef NSData::dataWithString(std::string_view bytes) {
  return std::make_shared<const NSData>(std::string(bytes));
}

void NSData::getBytes(void* buffer, std::size_t length) const {
  const std::size_t count = std::min(length, bytes_.size());
  if (count > 0) std::memcpy(buffer, bytes_.data(), count);
}

bool NSData::isEqualToData(const NSDataRef& other) const {
  return other != nullptr && bytes_ == other->bytes_;
}

std::string NSData::description() const {
  constexpr std::string_view kDigits = "0123456789abcdef";
  std::string out = "<";
  out.reserve(bytes_.size() * 2 + 2);
  for (const char byte : bytes_) {
    const auto value = static_cast<unsigned char>(byte);
    out += kDigits[value >> 4U];
    out += kDigits[value & 0xfU];
  }
  return out + ">";
}

}  // namespace yomber
