// Uploads and downloads of zarn, each beside cp of the same bytes in the same round: import of many
// small files until the last is confirmed in the store, providing them after eviction, and
// providing one large file with cold caches.

#include <fcntl.h>
#include <poll.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <memory>
#include <string>
#include <vector>

#include "benchmarks/figure.h"
#include "platform/foundation/drive_paths.h"
#include "platform/foundation/fault_attributes.h"
#include "platform/foundation/process_usage.h"
#include "platform/foundation/temporary_directory.h"
#include "zarn/drive.h"

namespace {

using namespace yomber;
namespace fs = std::filesystem;

constexpr std::chrono::seconds kPatience{600};

[[noreturn]] void giveUp(const std::string& text) {
  std::fprintf(stderr, "content_bench: %s\n", text.c_str());
  std::exit(1);
}

/// Says what is going on, and how long it took: a round takes a while.
template <typename Work>
double step(const std::string& what, const Work& work) {
  std::fprintf(stderr, "content_bench: %s", what.c_str());
  std::fflush(stderr);
  const double seconds = bench::secondsFor(work);
  std::fprintf(stderr, ": %.2f s\n", seconds);
  return seconds;
}

void run(const std::string& command) {
  if (std::system(command.c_str()) != 0) giveUp("cannot run: " + command);
}

/// Content that does not repeat.
void makeContent(const std::string& path, std::size_t size, std::uint64_t seed) {
  std::ofstream file(path, std::ios::binary);
  std::vector<std::uint64_t> block(std::min<std::size_t>(size, 1 << 20) / 8);
  std::uint64_t value = seed * 0x9e3779b97f4a7c15ULL + 1;
  for (std::size_t done = 0; done < size; done += block.size() * 8) {
    for (auto& word : block) {
      value ^= value << 13U;
      value ^= value >> 7U;
      value ^= value << 17U;
      word = value;
    }
    file.write(reinterpret_cast<const char*>(block.data()),
               static_cast<std::streamsize>(block.size() * 8));
  }
}

/// False, said once, where caches stay because we may not drop them.
bool dropCaches() {
  run("sync");
  const int file = open("/proc/sys/vm/drop_caches", O_WRONLY | O_CLOEXEC);
  const bool isDropped = file >= 0 && write(file, "3", 1) == 1;
  if (file >= 0) close(file);
  static bool isSaid = false;
  if (!isDropped && !isSaid) std::printf("caches stay warm: only root may drop them\n");
  isSaid = true;
  return isDropped;
}

/// A drive in this process, with somebody signed in.
class BenchDrive {
 public:
  BenchDrive() : paths_(DrivePaths::forHome(directory_.path() + "/home")) {
    NSErrorRef error = paths_.create();
    if (!error) drive_ = Drive::open(paths_, {}, &error);
    if (!error) error = drive_->account->signIn("bench");
    if (error) giveUp(error->description());
    (void)step("start a drive", [&] {
      drive_->start();
      if (!waitUntil([&] { return drive_->firstScan->isOpen(); }))
        giveUp("the drive does not start");
    });
  }
  ~BenchDrive() {
    (void)step("stop the drive", [&] { drive_->stop(); });
    (void)step("remove its files", [&] { fs::remove_all(directory_.path()); });
  }

  [[nodiscard]] std::string at(const std::string& path) const {
    return drive_->layout.root() + "/" + path;
  }
  [[nodiscard]] std::string beside(const std::string& path) const {
    return directory_.path() + "/" + path;
  }
  ContentEngine& engine() { return *drive_->engine; }

  template <typename Condition>
  static bool waitUntil(const Condition& condition) {
    const auto deadline = std::chrono::steady_clock::now() + kPatience;
    while (!condition()) {
      if (std::chrono::steady_clock::now() > deadline) return false;
      (void)poll(nullptr, 0, 1);
    }
    return true;
  }

  void waitUntilConfirmed(const std::vector<std::string>& paths) {
    for (const std::string& path : paths) {
      const bool isConfirmed = waitUntil([&] {
        const auto state = engine().contentState(path);
        return state && state->upload == ContentState::Upload::Confirmed;
      });
      if (!isConfirmed) giveUp("not confirmed: " + path);
    }
  }
  void evictAll(const std::vector<std::string>& paths) {
    std::atomic<std::size_t> left = paths.size();
    for (const std::string& path : paths) {
      engine().evict(path, [&left, path](const NSErrorRef& error) {
        if (error) giveUp(path + ": " + error->description());
        left.fetch_sub(1);
      });
    }
    if (!waitUntil([&] { return left.load() == 0; })) giveUp("evictions do not end");
  }
  void provideAll(const std::vector<std::string>& paths) {
    std::atomic<std::size_t> left = paths.size();
    std::vector<std::unique_ptr<ContentWish>> wishes;
    for (const std::string& path : paths) {
      wishes.push_back(engine().startProviding(path, 0, [&left, path](const NSErrorRef& error) {
        if (error) giveUp(path + ": " + error->description());
        left.fetch_sub(1);
      }));
    }
    if (!waitUntil([&] { return left.load() == 0; })) giveUp("downloads do not end");
    for (const std::string& path : paths) {
      if (isFaultAtPath(path)) giveUp("still a fault: " + path);
    }
  }

 private:
  TemporaryDirectory directory_;
  const DrivePaths paths_;
  std::shared_ptr<Drive> drive_;
};

struct Measured {
  bench::Repeated import;
  bench::Repeated small;
  bench::Repeated large;
};

void measureSmall(std::size_t count, Measured& measured) {
  BenchDrive drive;
  const std::string source = drive.beside("source");
  std::vector<std::string> paths;
  (void)step("make " + std::to_string(count) + " files", [&] {
    fs::create_directory(source);
    for (std::size_t i = 0; i < count; ++i) {
      const std::string name = "file " + std::to_string(i);
      makeContent(source + "/" + name, 4096, i + 1);
      paths.push_back(drive.at("small/" + name));
    }
    run("sync");
  });
  const double copied = step("cp -r and sync", [&] {
    run("cp -r '" + source + "' '" + drive.beside("copy") + "' && sync");
  });
  const double imported = step("import until confirmed", [&] {
    run("cp -r '" + source + "' '" + drive.at("small") + "'");
    drive.waitUntilConfirmed(paths);
  });
  measured.import.add(imported, copied);

  (void)step("evict", [&] { drive.evictAll(paths); });
  (void)step("sync", [] { run("sync"); });
  const double again =
      step("cp -r", [&] { run("cp -r '" + source + "' '" + drive.beside("copy 2") + "'"); });
  const double provided = step("provide", [&] { drive.provideAll(paths); });
  measured.small.add(provided, again);
}

void measureLarge(std::size_t bytes, std::size_t rounds, Measured& measured) {
  BenchDrive drive;
  const std::string source = drive.beside("large");
  const std::string path = drive.at("large");
  (void)step("make a file of " + std::to_string(bytes >> 20U) + " MiB",
             [&] { makeContent(source, bytes, 1); });
  (void)step("import until confirmed", [&] {
    run("cp '" + source + "' '" + path + "'");
    drive.waitUntilConfirmed({path});
  });
  for (std::size_t round = 0; round < rounds; ++round) {
    (void)step("evict", [&] { drive.evictAll({path}); });
    const std::string copy = drive.beside("copy");
    fs::remove(copy);
    (void)step("drop the caches", [] { (void)dropCaches(); });
    const double copied = step("cp", [&] { run("cp '" + source + "' '" + copy + "'"); });
    (void)step("drop the caches", [] { (void)dropCaches(); });
    const double provided = step("provide", [&] { drive.provideAll({path}); });
    measured.large.add(provided, copied);
  }
  (void)step("compare", [&] { run("cmp '" + source + "' '" + path + "'"); });
}

bool print(const bench::Repeated& measured, const std::string& name, const std::string& yardstick,
           double goal) {
  char text[64];
  std::snprintf(text, sizeof text, "at most %g times", goal);
  const auto figure =
      measured.figure(name, "s", yardstick, text, [goal](double ratio) { return ratio <= goal; });
  bench::print(figure);
  return figure.reached;
}

bool printMemory() {
  constexpr double kMiB = 1 << 20;
  constexpr double kGoal = 60;
  bench::Figure figure;
  figure.name = "memory of the daemon's parts after all of the above";
  figure.value = static_cast<double>(processUsage().residentBytes) / kMiB;
  figure.unit = "MiB";
  figure.goal = "at most 60 MiB";
  figure.reached = figure.value <= kGoal;
  bench::print(figure);
  return figure.reached;
}

}  // namespace

int main() {
  const std::size_t count = bench::sizeFromEnvironment("YOMBER_BENCH_SMALL_FILES", 10'000);
  const std::size_t bytes = bench::sizeFromEnvironment("YOMBER_BENCH_LARGE_BYTES", 1UL << 30U);
  const std::size_t rounds = bench::sizeFromEnvironment("YOMBER_BENCH_ROUNDS", 3);
  Measured measured;
  for (std::size_t round = 0; round < rounds; ++round) measureSmall(count, measured);
  measureLarge(bytes, rounds, measured);
  const std::string files = std::to_string(count) + " files of 4 KiB";
  bool isReached =
      print(measured.import, "import of " + files + " until confirmed", "cp -r and sync", 6);
  isReached &= print(measured.small, "providing " + files, "cp -r", 3);
  isReached &=
      print(measured.large, "providing " + std::to_string(bytes >> 20U) + " MiB, caches dropped",
            "cp", 1.3);
  isReached &= printMemory();
  return isReached ? 0 : 1;
}
