// The first scan of a large tree into a new database, and a restart with nothing changed, each
// beside a warm find over the same tree right before and after.

#include <algorithm>
#include <cstdio>
#include <memory>

#include "benchmarks/daemon_process.h"
#include "benchmarks/figure.h"
#include "benchmarks/many_files.h"

namespace {

using namespace yomber;

constexpr std::size_t kFilesInFolder = 1000;

void makeTree(const testing::TestDrive& drive, std::size_t count) {
  for (std::size_t folder = 0; folder * kFilesInFolder < count; ++folder) {
    const std::string name = "folder " + std::to_string(folder);
    drive.makeFolder(name);
    bench::makeFiles(drive.root() + "/" + name,
                     std::min(kFilesInFolder, count - folder * kFilesInFolder));
  }
}

/// Seconds from the daemon's start until its scan is done.
double secondsUntilScanned(testing::TestDrive& drive) {
  std::unique_ptr<bench::DaemonProcess> daemon;
  const double seconds =
      bench::secondsFor([&] { daemon = std::make_unique<bench::DaemonProcess>(drive); });
  daemon->end();
  return seconds;
}

bool print(const bench::Repeated& measured, const std::string& name, double goal) {
  char text[64];
  std::snprintf(text, sizeof text, "at most %g times", goal);
  const auto figure = measured.figure(name, "s", "warm find -printf", text,
                                      [goal](double ratio) { return ratio <= goal; });
  bench::print(figure);
  return figure.reached;
}

}  // namespace

int main() {
  const std::size_t count = bench::sizeFromEnvironment("YOMBER_BENCH_ITEMS", 1'000'000);
  const std::size_t rounds = bench::sizeFromEnvironment("YOMBER_BENCH_ROUNDS", 3);
  bench::Repeated first;
  bench::Repeated again;
  for (std::size_t round = 0; round < rounds; ++round) {
    // A tree of its own each time: zarn marks files with their ids after the scan, and reads the
    // marks when it meets such files again.
    testing::TestDrive drive;
    bench::DaemonProcess::adoptEnvironment(drive);
    makeTree(drive, count);
    const double before = bench::warmFindSeconds(drive.root());
    const double scan = secondsUntilScanned(drive);
    const double between = bench::findSeconds(drive.root());
    const double restart = secondsUntilScanned(drive);
    const double after = bench::findSeconds(drive.root());
    first.add(scan, (before + between) / 2);
    again.add(restart, (between + after) / 2);
  }
  const std::string files = std::to_string(count) + " files";
  const bool isFirstReached = print(first, "first scan of " + files, 4);
  const bool isAgainReached = print(again, "restart with nothing changed, " + files, 1.5);
  return isFirstReached && isAgainReached ? 0 : 1;
}
