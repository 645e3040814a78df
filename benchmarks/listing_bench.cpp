// One folder of very many items, listed to the end through host, extension and daemon, beside a
// warm find over the same folder right before and after.

#include <algorithm>
#include <chrono>
#include <fstream>
#include <numeric>
#include <stdexcept>

#include "benchmarks/figure.h"
#include "benchmarks/many_files.h"
#include "benchmarks/quiet_drive.h"
#include "platform/fileprovider/constants.h"
#include "tests/harness/test_drive.h"
#include "yomber/drive_client.h"

namespace {

using namespace yomber;
using Clock = std::chrono::steady_clock;

constexpr std::size_t kPagesCompared = 100;

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
  throw std::runtime_error("the extension's memory cannot be read");
}

struct Listed {
  std::vector<std::uint64_t> items;  ///< their raw ids
  double seconds = 0;
  std::vector<double> pageSeconds;
};

/// Lists the root, to the end or for so many pages.
Listed list(DriveClient& client, protocol::SortOrder order, std::size_t count, std::size_t pages) {
  Listed listed;
  listed.items.reserve(count);
  listed.pageSeconds.reserve(count / 200 + 1);
  NSErrorRef error;
  listed.seconds = bench::secondsFor([&] {
    auto pageStart = Clock::now();
    const auto onPage = [&](const std::vector<ItemFields>& page) {
      const auto now = Clock::now();
      listed.pageSeconds.push_back(std::chrono::duration<double>(now - pageStart).count());
      pageStart = now;
      for (const ItemFields& item : page) listed.items.push_back(item.rawID);
      return listed.pageSeconds.size() < pages;
    };
    error = client.list(NSFileProviderRootContainerItemIdentifier, order, onPage);
  });
  if (error) throw std::runtime_error(error->description());
  return listed;
}

/// Every item of the folder once, or the figures are worth nothing.
void check(Listed& listed, std::size_t count) {
  std::ranges::sort(listed.items);
  const auto twins = std::ranges::unique(listed.items);
  const auto different = static_cast<std::size_t>(twins.begin() - listed.items.begin());
  if (listed.items.size() == count && different == count) return;
  throw std::runtime_error("listed " + std::to_string(listed.items.size()) + " items, " +
                           std::to_string(different) + " different ones, of " +
                           std::to_string(count));
}

/// Seconds of the listing's first or last pages.
double secondsOfPages(const Listed& listed, std::size_t from, std::size_t count) {
  const auto begin = listed.pageSeconds.begin() + static_cast<std::ptrdiff_t>(from);
  return std::accumulate(begin, begin + static_cast<std::ptrdiff_t>(count), 0.0);
}

/// One order's figures.
struct Rounds {
  bench::Repeated rate;
  bench::Repeated pages;

  /// The last pages of a whole listing are set beside the first ones of the next, right after.
  void run(DriveClient& client, protocol::SortOrder order, std::size_t count,
           const std::string& folder);
  [[nodiscard]] bool print(const std::string& order) const;
};

void Rounds::run(DriveClient& client, protocol::SortOrder order, std::size_t count,
                 const std::string& folder) {
  const double before = bench::findSeconds(folder);
  Listed whole = list(client, order, count, count);
  const std::size_t compared = std::min(kPagesCompared, whole.pageSeconds.size() / 2);
  const Listed beginning = list(client, order, count, compared);
  const double after = bench::findSeconds(folder);
  check(whole, count);

  const auto items = static_cast<double>(count);
  rate.add(items / whole.seconds, items * 2 / (before + after));
  pages.add(secondsOfPages(whole, whole.pageSeconds.size() - compared, compared) * 1e3,
            secondsOfPages(beginning, 0, compared) * 1e3);
}

bool Rounds::print(const std::string& order) const {
  const std::string name = "listing by " + order;
  const auto wholes = rate.figure(name, "items/s", "warm find -printf", "at least 0.5 of it",
                                  [](double ratio) { return ratio >= 0.5; });
  const auto lasts =
      pages.figure(name + ", its last hundred pages", "ms", "its first hundred pages",
                   "at most 1.2 times", [](double ratio) { return ratio <= 1.2; });
  bench::print(wholes);
  bench::print(lasts);
  return wholes.reached && lasts.reached;
}

}  // namespace

int main() {
  const std::size_t count = bench::sizeFromEnvironment("YOMBER_BENCH_ITEMS", 1'000'000);
  const std::size_t rounds = bench::sizeFromEnvironment("YOMBER_BENCH_ROUNDS", 5);
  testing::TestDrive drive;
  bench::makeFiles(drive.root(), count);
  drive.up();
  bench::waitUntilQuiet(drive);
  (void)bench::findSeconds(drive.root());

  DriveClient client(DrivePaths::forHome(drive.home()));
  const pid_t extension = drive.pidOf(testing::TestDrive::Process::Extension);
  const double before = peakMegabytes(extension);
  Rounds byName;
  Rounds byDate;
  for (std::size_t round = 0; round < rounds; ++round) {
    byName.run(client, protocol::SortOrder::NAME, count, drive.root());
    byDate.run(client, protocol::SortOrder::DATE, count, drive.root());
  }
  const bool isReachedByName = byName.print("name");
  const bool isReachedByDate = byDate.print("date");
  bench::Figure growth;
  growth.name = "listing, growth of the extension's peak memory";
  growth.value = peakMegabytes(extension) - before;
  growth.unit = "MB";
  growth.goal = "at most 20 MB";
  growth.reached = growth.value <= 20;
  bench::print(growth);
  return isReachedByName && isReachedByDate && growth.reached ? 0 : 1;
}
