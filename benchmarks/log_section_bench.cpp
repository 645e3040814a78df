// What it costs to allocate and close a log section while debug logging is off.

#include <mutex>

#include "benchmarks/figure.h"
#include "provider/extension/log_sections.h"

int main() {
  using namespace yomber;
  constexpr int rounds = 2'000'000;

  std::mutex mutex;
  const double lock = bench::secondsFor([&] {
    for (int round = 0; round < rounds; ++round) {
      mutex.lock();
      asm volatile("" ::: "memory");
      mutex.unlock();
    }
  });
  const double section = bench::secondsFor([&] {
    for (int round = 0; round < rounds; ++round) {
      const LogSection opened(LogSectionLevel::Debug);
      asm volatile("" ::: "memory");
    }
  });
  bench::print(bench::compared("log section, allocate and close, debug off", section / rounds * 1e9,
                               "ns", "uncontended lock and unlock", lock / rounds * 1e9,
                               "at most 5 times", [](double ratio) { return ratio <= 5; }));
}
