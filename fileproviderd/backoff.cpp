#include "fileproviderd/backoff.h"

#include <memory>
#include <random>

namespace yomber {

Backoff::Random Backoff::systemRandom() {
  auto engine = std::make_shared<std::minstd_rand>(std::random_device{}());
  return [engine] { return std::uniform_real_distribution<double>(0.0, 1.0)(*engine); };
}

}  // namespace yomber
