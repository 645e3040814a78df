#pragma once

#include <cstdint>

namespace yomber {

/// What this process uses now; zero where the system does not say.
struct ProcessUsage {
  std::uint64_t residentBytes = 0;
  std::uint32_t openDescriptors = 0;
};
[[nodiscard]] ProcessUsage processUsage();

}  // namespace yomber
