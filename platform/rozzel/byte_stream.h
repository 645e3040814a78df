#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <utility>

namespace yomber {

/// Appends integers and texts to bytes, in the form that ByteSource reads.
class ByteSink {
 public:
  void addByte(std::uint8_t byte) { bytes_ += static_cast<char>(byte); }
  /// Seven bits a byte, the lowest first.
  void addNumber(std::uint64_t number);
  /// Eight bytes, the lowest first.
  void addFixed(std::uint64_t number);
  void addRaw(std::string_view raw) { bytes_ += raw; }
  /// Its length, then itself.
  void addText(std::string_view text) {
    addNumber(text.size());
    addRaw(text);
  }
  [[nodiscard]] std::string take() { return std::move(bytes_); }

 private:
  std::string bytes_;
};

/// Reads what ByteSink wrote. Whatever the bytes are, it stays within them: what does not fit is
/// answered with zero or nothing and makes the source bad for good.
class ByteSource {
 public:
  explicit ByteSource(std::string_view bytes) : rest_(bytes) {}

  std::uint8_t byte();
  std::uint64_t number();
  std::uint64_t fixed();
  std::string_view raw(std::uint64_t count);
  std::string_view text() { return raw(number()); }

  [[nodiscard]] bool good() const { return good_; }
  /// Good, and nothing is left.
  [[nodiscard]] bool finished() const { return good_ && rest_.empty(); }

 private:
  std::string_view rest_;
  bool good_ = true;
};

}  // namespace yomber
