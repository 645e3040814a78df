#pragma once

#include <chrono>
#include <thread>

namespace yomber {

/// Waits for what other threads bring about; false when it has not come in time.
template <typename Condition>
bool waitUntil(const Condition& condition) {
  constexpr std::chrono::seconds kPatience{60};
  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  while (!condition()) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    std::this_thread::yield();
  }
  return true;
}

}  // namespace yomber
