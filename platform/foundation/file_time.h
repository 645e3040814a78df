#pragma once

#include <cstdint>
#include <ctime>
#include <limits>

namespace yomber {

// Dates of files are kept as ns since the epoch in 64 bits: from the year 1677 to the year 2262. A
// file system may hold others. They become the nearest of these, and never another sign; the file
// itself keeps what it has.

inline constexpr std::int64_t kNanosecondsInSecond = 1'000'000'000;
/// Both can be negated.
inline constexpr std::int64_t kLatestFileTime = std::numeric_limits<std::int64_t>::max();
inline constexpr std::int64_t kEarliestFileTime = -kLatestFileTime;

[[nodiscard]] constexpr std::int64_t nanosecondsOf(std::int64_t seconds, std::int64_t nanoseconds) {
  std::int64_t value = 0;
  const bool isTooFar = __builtin_mul_overflow(seconds, kNanosecondsInSecond, &value) ||
                        __builtin_add_overflow(value, nanoseconds, &value) ||
                        value < kEarliestFileTime;
  if (!isTooFar) return value;
  return seconds < 0 ? kEarliestFileTime : kLatestFileTime;
}
[[nodiscard]] constexpr std::int64_t nanosecondsOf(const std::timespec& time) {
  return nanosecondsOf(time.tv_sec, time.tv_nsec);
}

/// With nanoseconds from 0 on, as the system wants them.
[[nodiscard]] constexpr std::timespec timespecOf(std::int64_t nanoseconds) {
  std::int64_t seconds = nanoseconds / kNanosecondsInSecond;
  std::int64_t rest = nanoseconds % kNanosecondsInSecond;
  if (rest < 0) {
    rest += kNanosecondsInSecond;
    --seconds;
  }
  return {.tv_sec = seconds, .tv_nsec = rest};
}

}  // namespace yomber
