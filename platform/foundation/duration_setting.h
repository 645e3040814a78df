#pragma once

#include <chrono>

namespace yomber {

/// The value of an environment variable, a whole number of milliseconds from `least` to a day;
/// `byDefault` where it is not set or, said in the log, is anything else.
[[nodiscard]] std::chrono::milliseconds durationSetting(const char* name,
                                                        std::chrono::milliseconds byDefault,
                                                        std::chrono::milliseconds least);

}  // namespace yomber
