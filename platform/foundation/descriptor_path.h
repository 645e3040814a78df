#pragma once

#include <string>

namespace yomber {

/// A path that leads to what is open as `descriptor`, for calls that take paths only: it works for
/// descriptors of places (O_PATH) too, and after what is open was renamed or removed. REQUIRES:
/// /proc.
[[nodiscard]] inline std::string pathOfDescriptor(int descriptor) {
  return "/proc/self/fd/" + std::to_string(descriptor);
}

}  // namespace yomber
