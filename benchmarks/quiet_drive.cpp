#include "benchmarks/quiet_drive.h"

#include <chrono>
#include <stdexcept>

#include "tests/harness/child_process.h"

namespace yomber::bench {
namespace {

constexpr std::chrono::minutes kPatience{60};

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
  if (!testing::eventually([&] { return isQuiet(drive); }, kPatience))
    throw std::runtime_error("the drive does not come to rest");
}

}  // namespace yomber::bench
