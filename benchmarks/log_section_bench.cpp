// What it costs to allocate and close a log section while debug logging is off. Both it and its
// yardstick are measured in a process of several threads, as every process of the drive is: without
// another thread a lock costs no atomic operation.

#include <condition_variable>
#include <mutex>
#include <stop_token>
#include <thread>

#include "benchmarks/figure.h"
#include "provider/extension/log_sections.h"

namespace {

using namespace yomber;

constexpr int kRounds = 101;
constexpr int kInOneGo = 20'000;

double nanosecondsOfLock(std::mutex& mutex) {
  return bench::secondsFor([&] {
           for (int i = 0; i < kInOneGo; ++i) {
             mutex.lock();
             asm volatile("" ::: "memory");
             mutex.unlock();
           }
         }) /
         kInOneGo * 1e9;
}

double nanosecondsOfSection() {
  return bench::secondsFor([] {
           for (int i = 0; i < kInOneGo; ++i) {
             const LogSection opened(LogSectionLevel::Debug);
             asm volatile("" ::: "memory");
           }
         }) /
         kInOneGo * 1e9;
}

}  // namespace

int main() {
  std::mutex sleeping;
  std::condition_variable_any never;
  const std::jthread other([&](const std::stop_token& stop) {
    std::unique_lock lock(sleeping);
    never.wait(lock, stop, [] { return false; });
  });

  std::mutex mutex;
  bench::Repeated measured;
  for (int round = 0; round < kRounds; ++round) {
    const double lock = nanosecondsOfLock(mutex);
    measured.add(nanosecondsOfSection(), lock);
  }
  const auto figure = measured.figure("log section, allocate and close, debug off", "ns",
                                      "uncontended lock and unlock", "at most 5 times",
                                      [](double ratio) { return ratio <= 5; });
  bench::print(figure);
  return figure.reached ? 0 : 1;
}
