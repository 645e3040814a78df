#include "platform/drawing/waiting.h"

#include <poll.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>

namespace yomber {
namespace {

/// Milliseconds, rounded up; never negative.
int remaining(std::chrono::steady_clock::time_point deadline) {
  const auto left = deadline - std::chrono::steady_clock::now();
  const std::int64_t count = std::chrono::ceil<std::chrono::milliseconds>(left).count();
  return static_cast<int>(std::clamp<std::int64_t>(count, 0, 1'000'000));
}

}  // namespace

bool waitReadable(int descriptor, std::chrono::steady_clock::time_point deadline) {
  pollfd polled{.fd = descriptor, .events = POLLIN, .revents = 0};
  while (true) {
    const int left = remaining(deadline);
    const int count = poll(&polled, 1, left);
    if (count > 0) return true;
    if (count == 0 && left == 0) return false;
    if (count < 0 && errno != EINTR && errno != EAGAIN) return false;
  }
}

}  // namespace yomber
