#include "platform/rozzel/byte_stream.h"

#include <utility>

namespace yomber {

void ByteSink::addNumber(std::uint64_t number) {
  while (number >= 0x80) {
    addByte(static_cast<std::uint8_t>(number | 0x80U));
    number >>= 7U;
  }
  addByte(static_cast<std::uint8_t>(number));
}

void ByteSink::addFixed(std::uint64_t number) {
  for (unsigned shift = 0; shift < 64; shift += 8) {
    addByte(static_cast<std::uint8_t>(number >> shift));
  }
}

std::uint8_t ByteSource::byte() {
  const std::string_view one = raw(1);
  return one.empty() ? std::uint8_t{0} : static_cast<std::uint8_t>(one.front());
}

std::uint64_t ByteSource::number() {
  std::uint64_t result = 0;
  for (unsigned shift = 0; shift < 64; shift += 7) {
    const std::uint64_t next = byte();
    const std::uint64_t bits = next & 0x7fU;
    if (shift == 63 && bits > 1) break;
    result |= bits << shift;
    if ((next & 0x80U) == 0) return good_ ? result : 0;
  }
  good_ = false;
  return 0;
}

std::uint64_t ByteSource::fixed() {
  std::uint64_t result = 0;
  for (unsigned shift = 0; shift < 64; shift += 8) result |= std::uint64_t{byte()} << shift;
  return good_ ? result : 0;
}

std::string_view ByteSource::raw(std::uint64_t count) {
  if (!good_ || count > rest_.size()) {
    good_ = false;
    return {};
  }
  const std::string_view result = rest_.substr(0, static_cast<std::size_t>(count));
  rest_.remove_prefix(static_cast<std::size_t>(count));
  return result;
}

}  // namespace yomber
