#pragma once

#include <array>
#include <cstdint>
#include <cstring>
#include <string>
#include <string_view>

namespace yomber {

/// The name of one of very many: up to 15 bytes take no memory beside this, others no more than
/// they need.
class ShortName {
 public:
  ShortName() = default;
  ~ShortName() { clear(); }
  ShortName(const ShortName&) = delete;
  ShortName& operator=(const ShortName&) = delete;

  /// `name` is no part of this one.
  ShortName& operator=(std::string_view name) {
    clear();
    if (name.size() <= bytes_.size()) {
      name.copy(bytes_.data(), name.size());
      length_ = static_cast<std::uint8_t>(name.size());
      return *this;
    }
    const Apart apart{.bytes = new char[name.size()],
                      .length = static_cast<std::uint32_t>(name.size())};
    name.copy(apart.bytes, name.size());
    std::memcpy(bytes_.data(), static_cast<const void*>(&apart.bytes), sizeof apart.bytes);
    std::memcpy(bytes_.data() + sizeof apart.bytes, &apart.length, sizeof apart.length);
    length_ = kApart;
    return *this;
  }

  void clear() {
    if (length_ == kApart) delete[] apart().bytes;
    length_ = 0;
  }

  [[nodiscard]] std::string_view view() const {
    if (length_ != kApart) return {bytes_.data(), length_};
    const Apart there = apart();
    return {there.bytes, there.length};
  }
  [[nodiscard]] std::string string() const { return std::string(view()); }
  friend bool operator==(const ShortName& a, std::string_view b) { return a.view() == b; }

 private:
  struct Apart {
    char* bytes = nullptr;
    std::uint32_t length = 0;
  };
  static constexpr std::uint8_t kApart = 255;

  [[nodiscard]] Apart apart() const {
    Apart result;
    std::memcpy(static_cast<void*>(&result.bytes), bytes_.data(), sizeof result.bytes);
    std::memcpy(&result.length, bytes_.data() + sizeof result.bytes, sizeof result.length);
    return result;
  }

  std::array<char, 15> bytes_{};  ///< the name, or where it is and its length
  std::uint8_t length_ = 0;
};

}  // namespace yomber
