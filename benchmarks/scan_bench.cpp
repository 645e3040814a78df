// The first scan of a large tree into a new database, and a restart with nothing changed.

#include <csignal>
#include <filesystem>
#include <iostream>

#include "benchmarks/figure.h"
#include "benchmarks/many_files.h"
#include "platform/ipc/call.h"
#include "tests/harness/test_drive.h"
#include "yomber/drive_client.h"
#include "yomber/drive_status.h"

namespace {

using namespace yomber;

/// Seconds from the daemon's start until its scan is done; it is left running.
double secondsUntilScanned(testing::TestDrive& drive,
                           std::unique_ptr<testing::LineProcess>& daemon) {
  return bench::secondsFor([&] {
    daemon = std::make_unique<testing::LineProcess>(
        std::vector<std::string>{testing::programPath("zarn"), "--home", drive.home()},
        drive.environment());
    const bool done = testing::eventually(
        [&] {
          const DriveStatus status =
              readDriveStatus(DrivePaths::forHome(drive.home()), std::nullopt);
          return status.daemon && !status.daemon->scanning;
        },
        std::chrono::minutes(10));
    if (!done) throw std::runtime_error("the scan did not end");
  });
}

void end(std::unique_ptr<testing::LineProcess>& daemon) {
  kill(daemon->pid(), SIGTERM);
  if (daemon->waitForEnd() != 0) throw std::runtime_error("zarn did not end well");
  daemon.reset();
}

}  // namespace

int main() {
  const std::size_t count = bench::sizeFromEnvironment("YOMBER_BENCH_ITEMS", 1'000'000);
  testing::TestDrive drive;
  for (const auto& [name, value] : drive.environment()) setenv(name.c_str(), value.c_str(), 1);
  constexpr std::size_t perFolder = 1000;
  for (std::size_t folder = 0; folder * perFolder < count; ++folder) {
    const std::string name = "folder " + std::to_string(folder);
    drive.makeFolder(name);
    bench::makeFiles(drive.root() + "/" + name, std::min(perFolder, count - folder * perFolder));
  }
  const double find = bench::warmFindSeconds(drive.root());

  std::unique_ptr<testing::LineProcess> daemon;
  const double first = secondsUntilScanned(drive, daemon);
  bench::print(bench::compared("first scan of " + std::to_string(count) + " files", first, "s",
                               "warm find -printf", find, "at most 4 times",
                               [](double ratio) { return ratio <= 4; }));
  end(daemon);
  const double again = secondsUntilScanned(drive, daemon);
  bench::print(bench::compared("restart with nothing changed", again, "s", "warm find -printf",
                               find, "at most 1.5 times",
                               [](double ratio) { return ratio <= 1.5; }));
  end(daemon);
}
