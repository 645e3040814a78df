// From a change on disk until `yomber watch` has printed it, while changes go on at a steady rate.

#include <atomic>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <map>
#include <set>
#include <thread>
#include <unordered_map>

#include "benchmarks/figure.h"
#include "tests/harness/test_drive.h"

namespace {

using namespace yomber;
using Clock = std::chrono::steady_clock;

/// When each file was made, by name. Written by the maker before the file shows, read afterwards.
struct Changes {
  std::vector<Clock::time_point> madeAt;
  explicit Changes(std::size_t count) : madeAt(count) {}
};

/// Makes files at a steady rate; returns when all are made.
void makeSteadily(const std::string& folder, Changes& changes, std::size_t perSecond) {
  const auto start = Clock::now();
  for (std::size_t number = 0; number < changes.madeAt.size(); ++number) {
    std::this_thread::sleep_until(start +
                                  std::chrono::microseconds(number * 1'000'000 / perSecond));
    const std::string path = folder + "/change " + std::to_string(number);
    changes.madeAt[number] = Clock::now();
    std::ofstream(path).put('x');
  }
}

}  // namespace

int main() {
  const std::size_t count = bench::sizeFromEnvironment("YOMBER_BENCH_CHANGES", 100'000);
  constexpr std::size_t perSecond = 1000;
  testing::TestDrive drive;
  drive.up();
  testing::LineProcess watch(drive.commandLine({"--json", "watch", "--list"}), drive.environment());
  drive.write("first");
  if (!watch.readUntil(
          [](const std::string& line) { return line.find("\"first\"") != std::string::npos; }))
    return 1;

  Changes changes(count);
  std::jthread maker([&] { makeSteadily(drive.root(), changes, perSecond); });
  std::vector<double> milliseconds;
  std::set<std::string> held{"first"};
  std::unordered_map<std::string, std::string> names;
  while (milliseconds.size() < count) {
    const auto line = watch.nextLine(Clock::now() + std::chrono::seconds(30));
    if (!line) break;
    const auto now = Clock::now();
    const auto json = nlohmann::json::parse(*line);
    if (json["event"] != "added") continue;
    const std::string name = json["item"]["name"];
    if (!held.insert(name).second) continue;
    const std::size_t number = std::stoull(name.substr(std::string("change ").size()));
    milliseconds.push_back(
        std::chrono::duration<double, std::milli>(now - changes.madeAt[number]).count());
  }
  maker.join();

  std::set<std::string> onDisk;
  for (const auto& entry : std::filesystem::directory_iterator(drive.root()))
    onDisk.insert(entry.path().filename());
  bench::Figure latency;
  latency.name = "change until watch printed it, 99th percentile";
  latency.value = bench::percentile(milliseconds, 0.99);
  latency.unit = "ms";
  latency.goal = "at most 50 ms at 1,000 changes a second";
  latency.reached = latency.value <= 50;
  bench::print(latency);
  latency.name = "change until watch printed it, median";
  latency.value = bench::percentile(milliseconds, 0.5);
  latency.goal.clear();
  bench::print(latency);
  bench::print(bench::compared("items that the watcher holds after all changes",
                               static_cast<double>(held.size()), "items", "items on disk",
                               static_cast<double>(onDisk.size()), "the same items",
                               [&](double) { return held == onDisk; }));
}
