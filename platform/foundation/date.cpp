#include "platform/foundation/date.h"

#include <array>
#include <chrono>

namespace yomber {
namespace {

constexpr std::int64_t kNanosecondsPerSecond = 1'000'000'000;

}  // namespace

NSDate NSDate::fromTimespec(const std::timespec& time) {
  // Saturates: a file system may hold dates that nanoseconds in 64 bits cannot.
  std::int64_t value = 0;
  const bool tooFar =
      __builtin_mul_overflow(std::int64_t{time.tv_sec}, kNanosecondsPerSecond, &value) ||
      __builtin_add_overflow(value, std::int64_t{time.tv_nsec}, &value);
  if (!tooFar) return NSDate(value);
  return NSDate(time.tv_sec < 0 ? std::numeric_limits<std::int64_t>::min()
                                : std::numeric_limits<std::int64_t>::max());
}

NSDate NSDate::now() {
  const auto sinceEpoch = std::chrono::system_clock::now().time_since_epoch();
  return NSDate(std::chrono::duration_cast<std::chrono::nanoseconds>(sinceEpoch).count());
}

std::string NSDate::description() const {
  std::int64_t fraction = nanoseconds_ % kNanosecondsPerSecond;
  std::time_t seconds = nanoseconds_ / kNanosecondsPerSecond;
  if (fraction < 0) {
    fraction += kNanosecondsPerSecond;
    --seconds;
  }
  std::tm parts{};
  gmtime_r(&seconds, &parts);
  std::array<char, 32> buffer{};
  std::string out(buffer.data(),
                  std::strftime(buffer.data(), buffer.size(), "%Y-%m-%dT%H:%M:%S", &parts));
  if (fraction != 0) {
    std::string digits = std::to_string(fraction);
    digits.insert(0, 9 - digits.size(), '0');
    digits.erase(digits.find_last_not_of('0') + 1);
    out += "." + digits;
  }
  return out + "Z";
}

}  // namespace yomber
