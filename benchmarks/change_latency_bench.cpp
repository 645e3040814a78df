// From a change on disk until `yomber watch` has printed it, while changes go on at a steady rate:
// new files, and older ones that grow, get another name or go.

#include <array>
#include <chrono>
#include <cstdio>
#include <deque>
#include <filesystem>
#include <fstream>
#include <map>
#include <optional>
#include <thread>
#include <unordered_map>
#include <vector>

#include <fcntl.h>
#include <unistd.h>

#include "benchmarks/figure.h"
#include "tests/harness/test_drive.h"

namespace {

using namespace yomber;
using Clock = std::chrono::steady_clock;

constexpr std::size_t kPerSecond = 1000;
/// A file is left alone for so many changes, so that no two of its own fall together.
constexpr std::size_t kRest = 2000;

struct Change {
  enum class Kind : std::uint8_t { Create, Grow, Rename, Remove };
  Kind kind = Kind::Create;
  std::string name;
  std::string newName;     ///< after a renaming
  std::uint64_t size = 0;  ///< after growing; no other file ever has it
  Clock::time_point madeAt;
};

/// All changes, and how each of them is known again when it is told of.
struct Plan {
  explicit Plan(std::size_t count);
  std::vector<Change> changes;
  std::unordered_map<std::string, std::size_t> byName;
  std::unordered_map<std::uint64_t, std::size_t> bySize;
  std::unordered_map<std::string, std::size_t> byRemovedName;
};

Plan::Plan(std::size_t count) {
  using Kind = Change::Kind;
  constexpr std::array<Kind, 10> kinds{Kind::Create, Kind::Grow,   Kind::Create, Kind::Rename,
                                       Kind::Create, Kind::Remove, Kind::Create, Kind::Grow,
                                       Kind::Create, Kind::Create};
  std::deque<std::pair<std::size_t, std::string>> rested;
  for (std::size_t number = 0; number < count; ++number) {
    const bool hasOld = !rested.empty() && rested.front().first + kRest <= number;
    Change change;
    change.kind = hasOld ? kinds[number % kinds.size()] : Kind::Create;
    if (change.kind == Kind::Create) {
      change.name = "change " + std::to_string(number);
      rested.emplace_back(number, change.name);
      byName[change.name] = number;
    } else {
      change.name = std::move(rested.front().second);
      rested.pop_front();
      change.size = number + 1;
      change.newName = "renamed " + std::to_string(number);
      if (change.kind == Kind::Grow) bySize[change.size] = number;
      if (change.kind == Kind::Rename) byName[change.newName] = number;
      if (change.kind == Kind::Remove) byRemovedName[change.name] = number;
    }
    changes.push_back(std::move(change));
  }
}

/// As programs write: what they keep open is told of a moment later, what they close at once.
bool grow(const std::string& path, std::uint64_t size) {
  const int file = ::open(path.c_str(), O_WRONLY | O_CLOEXEC);
  if (file < 0) return false;
  const bool isGrown = ::ftruncate(file, static_cast<off_t>(size)) == 0;
  return ::close(file) == 0 && isGrown;
}

void make(const std::string& folder, Change& change) {
  const std::string path = folder + "/" + change.name;
  const std::string newPath = folder + "/" + change.newName;
  change.madeAt = Clock::now();
  bool isMade = false;
  switch (change.kind) {
    case Change::Kind::Create:
      isMade = std::ofstream(path).good();
      break;
    case Change::Kind::Grow:
      isMade = grow(path, change.size);
      break;
    case Change::Kind::Rename:
      isMade = std::rename(path.c_str(), newPath.c_str()) == 0;
      break;
    case Change::Kind::Remove:
      isMade = ::unlink(path.c_str()) == 0;
      break;
  }
  if (!isMade) throw std::runtime_error("a change of " + path + " failed");
}

/// What a watcher holds that does as it is told, and when it was told of each change.
class Watcher {
 public:
  explicit Watcher(const Plan& plan) : plan_(plan), toldAt_(plan.changes.size()) {}

  void takeLine(const std::string& line, Clock::time_point now) {
    const auto json = nlohmann::json::parse(line);
    const std::string event = json["event"];
    if (event == "removed") {
      const auto known = held_.find(json["id"]);
      if (known == held_.end()) return;
      note(plan_.byRemovedName, known->second.first, now);
      held_.erase(known);
    } else if (json.contains("item")) {
      const auto& item = json["item"];
      auto& [name, size] = held_[item["id"]];
      name = item["name"];
      size = item["size"];
      note(plan_.byName, name, now);
      note(plan_.bySize, size, now);
    }
  }
  [[nodiscard]] bool wasToldAll() const { return told_ == toldAt_.size(); }
  [[nodiscard]] std::size_t told() const { return told_; }
  /// Sizes by name.
  [[nodiscard]] std::map<std::string, std::uint64_t> held() const {
    std::map<std::string, std::uint64_t> items;
    for (const auto& [id, item] : held_) items.insert(item);
    return items;
  }
  /// Of what it was told; REQUIRES: no more changes are being made.
  [[nodiscard]] std::vector<double> milliseconds(std::optional<Change::Kind> kind = {}) const {
    std::vector<double> times;
    for (std::size_t i = 0; i < toldAt_.size(); ++i) {
      if (!toldAt_[i] || (kind && plan_.changes[i].kind != *kind)) continue;
      const auto taken = *toldAt_[i] - plan_.changes[i].madeAt;
      times.push_back(std::chrono::duration<double, std::milli>(taken).count());
    }
    return times;
  }

 private:
  template <typename Key>
  void note(const std::unordered_map<Key, std::size_t>& changes, const Key& key,
            Clock::time_point now) {
    const auto change = changes.find(key);
    if (change == changes.end() || toldAt_[change->second]) return;
    toldAt_[change->second] = now;
    ++told_;
  }

  const Plan& plan_;
  std::vector<std::optional<Clock::time_point>> toldAt_;
  std::size_t told_ = 0;
  std::map<std::string, std::pair<std::string, std::uint64_t>> held_;
};

std::map<std::string, std::uint64_t> onDisk(const std::string& folder) {
  std::map<std::string, std::uint64_t> files;
  for (const auto& entry : std::filesystem::directory_iterator(folder))
    files[entry.path().filename()] = entry.file_size();
  return files;
}

bool report(const Watcher& watcher, const std::string& folder) {
  const auto times = watcher.milliseconds();
  bench::Figure latency;
  latency.name = "change until watch printed it, 99th percentile";
  latency.value = bench::percentile(times, 0.99);
  latency.unit = "ms";
  latency.goal = "at most 50 ms at 1,000 changes a second";
  latency.reached = watcher.wasToldAll() && latency.value <= 50;
  bench::print(latency);
  bench::Figure median;
  median.name = "change until watch printed it, median";
  median.value = bench::percentile(times, 0.5);
  median.unit = "ms";
  bench::print(median);
  for (const auto& [name, kind] :
       {std::pair{"new files", Change::Kind::Create}, std::pair{"growing", Change::Kind::Grow},
        std::pair{"renamings", Change::Kind::Rename},
        std::pair{"removals", Change::Kind::Remove}}) {
    bench::Figure each;
    each.name = std::string("the same of ") + name + ", 99th percentile";
    each.value = bench::percentile(watcher.milliseconds(kind), 0.99);
    each.unit = "ms";
    bench::print(each);
  }
  const auto held = watcher.held();
  const auto files = onDisk(folder);
  const auto same = bench::compared("items that the watcher holds after all changes",
                                    static_cast<double>(held.size()), "items", "files on disk",
                                    static_cast<double>(files.size()), "the same names and sizes",
                                    [&](double) { return held == files; });
  bench::print(same);
  if (!watcher.wasToldAll())
    std::fprintf(stderr, "The watcher was told of %zu changes only.\n", watcher.told());
  return latency.reached && same.reached;
}

}  // namespace

int main() {
  Plan plan(bench::sizeFromEnvironment("YOMBER_BENCH_CHANGES", 100'000));
  testing::TestDrive drive;
  drive.up();
  testing::LineProcess watch(drive.commandLine({"--json", "watch", "--list"}), drive.environment());
  drive.write("first");
  Watcher watcher(plan);
  const auto isFirst = [&](const std::string& line) {
    watcher.takeLine(line, Clock::now());
    return line.find("\"first\"") != std::string::npos;
  };
  if (!watch.readUntil(isFirst)) throw std::runtime_error("the watch does not begin");

  {
    const std::jthread maker([&] {
      const auto start = Clock::now();
      for (std::size_t number = 0; number < plan.changes.size(); ++number) {
        std::this_thread::sleep_until(start +
                                      std::chrono::microseconds(number * 1'000'000 / kPerSecond));
        make(drive.root(), plan.changes[number]);
      }
    });
    while (!watcher.wasToldAll()) {
      const auto line = watch.nextLine(Clock::now() + std::chrono::seconds(30));
      if (!line) break;
      watcher.takeLine(*line, Clock::now());
    }
  }
  return report(watcher, drive.root()) ? 0 : 1;
}
