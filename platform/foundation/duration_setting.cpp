#include "platform/foundation/duration_setting.h"

#include <charconv>
#include <cstdint>
#include <cstdlib>
#include <string_view>

#include "platform/foundation/log.h"

namespace yomber {

using std::chrono::milliseconds;

milliseconds durationSetting(const char* name, milliseconds byDefault, milliseconds least) {
  const char* const text = std::getenv(name);
  if (text == nullptr) return byDefault;
  const std::string_view digits(text);
  std::int64_t value = 0;
  const auto [end, failure] = std::from_chars(digits.data(), digits.data() + digits.size(), value);
  const bool isNumber = failure == std::errc() && end == digits.data() + digits.size();
  if (isNumber && value >= least.count() && value <= milliseconds(std::chrono::hours(24)).count())
    return milliseconds(value);
  log_error(defaultLog(),
            "[ERROR] %s is \"%s\": give it a number of milliseconds from %lld to a day; using %lld",
            name, digits, static_cast<long long>(least.count()),
            static_cast<long long>(byDefault.count()));
  return byDefault;
}

}  // namespace yomber
