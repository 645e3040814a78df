#pragma once

#include <atomic>
#include <cstdint>

namespace yomber {

/// What is noted of a folder for those who list it, in one byte. Thread-safety: any operation on
/// any thread.
class ListingMarks {
 public:
  /// An entry was looked up.
  void noteLookup() { set(kLookup); }
  /// Whether one was since this was last asked.
  [[nodiscard]] bool takeLookup() { return take(kLookup); }

  /// The kernel was told names of entries, and nothing else of them.
  void noteNames() { set(kNames); }
  /// Whether it was since this was last asked.
  [[nodiscard]] bool takeNames() { return take(kNames); }

 private:
  static constexpr std::uint8_t kLookup = 1;
  static constexpr std::uint8_t kNames = 2;

  /// Often set already, by many at once: then only read.
  void set(std::uint8_t mark) {
    if ((marks_.load(std::memory_order_relaxed) & mark) == 0) marks_.fetch_or(mark);
  }
  bool take(std::uint8_t mark) {
    return (marks_.fetch_and(static_cast<std::uint8_t>(~mark)) & mark) != 0;
  }

  std::atomic<std::uint8_t> marks_ = 0;
};

}  // namespace yomber
