#pragma once

#include <chrono>
#include <cstdint>
#include <map>
#include <string>
#include <utility>

namespace yomber {

/// What zarn says of its downloads at one moment.
struct Downloads {
  struct Bytes {
    std::uint64_t done = 0;
    std::uint64_t total = 0;
    bool operator==(const Bytes&) const = default;
  };
  std::map<std::string, Bytes> running;  ///< by location
  bool operator==(const Downloads&) const = default;
};

/// Until when one wish for content is waited for: for as long as bytes come, and a limit longer.
///
/// While its own content is being copied, those bytes count; while it waits for its turn, or for
/// what was copied together with it, those of others, which it waits for.
///
/// Thread-safety: one thread at a time.
class WishDeadline {
 public:
  using TimePoint = std::chrono::steady_clock::time_point;

  WishDeadline(std::string path, std::chrono::milliseconds limit, TimePoint now)
      : path_(std::move(path)), limit_(limit), when_(now + limit) {}

  /// `before` is what was said the last time.
  void look(const Downloads& before, const Downloads& after, TimePoint now);
  [[nodiscard]] bool isOver(TimePoint now) const { return now >= when_; }

 private:
  const std::string path_;
  const std::chrono::milliseconds limit_;
  TimePoint when_;
};

}  // namespace yomber
