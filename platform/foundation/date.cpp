#include "platform/foundation/date.h"

#include <array>
#include <chrono>

#include "platform/foundation/file_time.h"

namespace yomber {

NSDate NSDate::fromTimespec(const std::timespec& time) { return NSDate(nanosecondsOf(time)); }

NSDate NSDate::now() {
  const auto sinceEpoch = std::chrono::system_clock::now().time_since_epoch();
  return NSDate(std::chrono::duration_cast<std::chrono::nanoseconds>(sinceEpoch).count());
}

std::string NSDate::description() const {
  const auto [seconds, fraction] = timespecOf(nanoseconds_);
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
