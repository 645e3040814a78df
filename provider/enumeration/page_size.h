#pragma once

#include <cstdint>

namespace yomber {

/// How many entries an enumerator asks the daemon for at a time.
inline constexpr std::uint32_t kEnumerationPageSize = 200;

}  // namespace yomber
