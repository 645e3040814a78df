#pragma once

#include <chrono>

namespace yomber {

/// Waits until `descriptor` can be read, or its other end is gone; false when the deadline has
/// passed.
[[nodiscard]] bool waitReadable(int descriptor, std::chrono::steady_clock::time_point deadline);

}  // namespace yomber
