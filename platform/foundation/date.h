#pragma once

#include <compare>
#include <cstdint>
#include <ctime>
#include <limits>
#include <string>

namespace yomber {

/// A point in time with nanosecond resolution, as file systems keep it.
///
/// Value type; nil dates are `std::optional<NSDate>`.
class NSDate {
 public:
  constexpr NSDate() = default;
  static constexpr NSDate fromNanoseconds(std::int64_t sinceEpoch) { return NSDate(sinceEpoch); }
  static NSDate fromTimespec(const std::timespec& time);
  static NSDate now();
  /// The latest date there is; reads as "never".
  static constexpr NSDate distantFuture() {
    return NSDate(std::numeric_limits<std::int64_t>::max());
  }

  /// Nanoseconds since 1970-01-01T00:00:00Z.
  [[nodiscard]] constexpr std::int64_t nanoseconds() const { return nanoseconds_; }
  /// ISO 8601 in UTC with the fraction that is there, e.g. "2026-03-01T12:00:00.25Z".
  [[nodiscard]] std::string description() const;

  friend constexpr auto operator<=>(NSDate, NSDate) = default;

 private:
  explicit constexpr NSDate(std::int64_t sinceEpoch) : nanoseconds_(sinceEpoch) {}
  std::int64_t nanoseconds_ = 0;
};

}  // namespace yomber
