// One folder of very many items, listed to the end through host, extension and daemon.

#include <fstream>
#include <iostream>
#include <numeric>

#include "benchmarks/figure.h"
#include "benchmarks/many_files.h"
#include "platform/fileprovider/constants.h"
#include "tests/harness/test_drive.h"
#include "yomber/drive_client.h"

namespace {

using namespace yomber;

/// A process's peak resident memory in megabytes.
double peakMegabytes(pid_t pid) {
  std::ifstream status("/proc/" + std::to_string(pid) + "/status");
  for (std::string word; status >> word;) {
    if (word == "VmHWM:") {
      double kilobytes = 0;
      status >> kilobytes;
      return kilobytes / 1000;
    }
  }
  return 0;
}

struct Listed {
  std::size_t items = 0;
  double seconds = 0;
  std::vector<double> pageSeconds;
};

Listed list(DriveClient& client, protocol::SortOrder order) {
  Listed listed;
  auto pageStart = std::chrono::steady_clock::now();
  NSErrorRef error;
  listed.seconds = bench::secondsFor([&] {
    error = client.list(
        NSFileProviderRootContainerItemIdentifier, order, [&](const std::vector<ItemFields>& page) {
          const auto now = std::chrono::steady_clock::now();
          listed.pageSeconds.push_back(std::chrono::duration<double>(now - pageStart).count());
          pageStart = now;
          listed.items += page.size();
          return true;
        });
  });
  if (error) throw std::runtime_error(error->description());
  return listed;
}

void report(const char* order, const Listed& listed, double findRate) {
  const std::string name = std::string("listing by ") + order;
  const double rate = static_cast<double>(listed.items) / listed.seconds;
  bench::print(bench::compared(name, rate, "items/s", "warm find -printf", findRate,
                               "at least 0.5 of it", [](double ratio) { return ratio >= 0.5; }));
  const std::size_t pages = std::min<std::size_t>(100, listed.pageSeconds.size() / 2);
  const auto cost = [&](auto from) {
    return std::accumulate(from, from + static_cast<std::ptrdiff_t>(pages), 0.0) * 1e3;
  };
  bench::print(bench::compared(name + ", its last hundred pages",
                               cost(listed.pageSeconds.end() - static_cast<std::ptrdiff_t>(pages)),
                               "ms", "its first hundred pages", cost(listed.pageSeconds.begin()),
                               "at most 1.2 times", [](double ratio) { return ratio <= 1.2; }));
}

}  // namespace

int main() {
  const std::size_t count = bench::sizeFromEnvironment("YOMBER_BENCH_ITEMS", 1'000'000);
  testing::TestDrive drive;
  bench::makeFiles(drive.root(), count);
  drive.up();
  testing::eventually([&] { return drive.status()["zarn"]["scanning"] == false; },
                      std::chrono::minutes(5));

  const double findRate = static_cast<double>(count) / bench::warmFindSeconds(drive.root());
  DriveClient client(DrivePaths::forHome(drive.home()));
  const pid_t extension = drive.pidOf(testing::TestDrive::Process::Extension);
  const double before = peakMegabytes(extension);
  for (const auto& [name, order] : {std::pair{"name", protocol::SortOrder::NAME},
                                    std::pair{"date", protocol::SortOrder::DATE}}) {
    const Listed listed = list(client, order);
    if (listed.items != count)
      throw std::runtime_error("listed " + std::to_string(listed.items) + " items");
    report(name, listed, findRate);
  }
  bench::Figure growth;
  growth.name = "listing, growth of the extension's peak memory";
  growth.value = peakMegabytes(extension) - before;
  growth.unit = "MB";
  growth.goal = "at most 20 MB";
  growth.reached = growth.value <= 20;
  bench::print(growth);
}
