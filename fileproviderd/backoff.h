#pragma once

#include <algorithm>
#include <chrono>
#include <functional>
#include <utility>

namespace yomber {

/// How long to wait before the next attempt: doubling from `first` to `longest`, each time
/// shortened by a random quarter at most, so that those who failed together do not come back
/// together.
class Backoff {
 public:
  /// Answers numbers from 0 (inclusive) to 1 (exclusive).
  using Random = std::function<double()>;

  explicit Backoff(Random random, std::chrono::milliseconds first = std::chrono::milliseconds{50},
                   std::chrono::milliseconds longest = std::chrono::milliseconds{5'000})
      : random_(std::move(random)), first_(first), longest_(longest), next_(first) {}

  [[nodiscard]] std::chrono::milliseconds next() {
    const auto whole = static_cast<double>(next_.count());
    next_ = std::min(longest_, next_ * 2);
    constexpr double kLargestCut = 0.25;
    return std::chrono::milliseconds(
        static_cast<std::chrono::milliseconds::rep>(whole * (1.0 - kLargestCut * random_())));
  }
  void reset() { next_ = first_; }

  /// A generator seeded by the system.
  [[nodiscard]] static Random systemRandom();

 private:
  const Random random_;
  const std::chrono::milliseconds first_;
  const std::chrono::milliseconds longest_;
  std::chrono::milliseconds next_;
};

}  // namespace yomber
