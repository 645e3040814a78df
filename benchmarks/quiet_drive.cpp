#include "benchmarks/quiet_drive.h"

#include <chrono>
#include <stdexcept>

#include "tests/harness/child_process.h"

namespace yomber::bench {
namespace {

using Clock = std::chrono::steady_clock;

constexpr std::chrono::minutes kPatience{60};
/// Jobs are made a few thousand at a time: those that there are may be done before the next ones.
constexpr std::chrono::seconds kRest{2};

bool isQuiet(const testing::TestDrive& drive) {
  const auto status = drive.status();
  if (!status.is_object() || !status.contains("zarn") || !status.contains("transfers"))
    return false;
  const auto& transfers = status["transfers"];
  return status["zarn"]["scanning"] == false && transfers["waiting"] == 0 &&
         transfers["under_way"].empty();
}

}  // namespace

void waitUntilQuiet(const testing::TestDrive& drive) {
  Clock::time_point lastBusy = Clock::now();
  const auto hasRested = [&] {
    if (!isQuiet(drive)) lastBusy = Clock::now();
    return Clock::now() - lastBusy >= kRest;
  };
  if (!testing::eventually(hasRested, kPatience))
    throw std::runtime_error("the drive does not come to rest");
}

}  // namespace yomber::bench
