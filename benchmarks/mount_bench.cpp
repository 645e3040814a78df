// The mount beside the native folder on the same disk, and beside other programs' mounts of that
// folder where they are installed: each figure is a ratio to the native folder in the same round.

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/statfs.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "benchmarks/figure.h"
#include "benchmarks/many_files.h"
#include "benchmarks/quiet_drive.h"
#include "tests/harness/mounted_drive.h"

namespace {

using namespace yomber;
namespace fs = std::filesystem;

constexpr std::size_t kBlock = 4096;
constexpr std::size_t kSyncedFiles = 500;

[[noreturn]] void giveUp(const std::string& text) {
  std::fprintf(stderr, "mount_bench: %s\n", text.c_str());
  std::exit(1);
}

void run(const std::string& command) {
  if (std::system(command.c_str()) != 0) giveUp("cannot run: " + command);
}

/// What the kernel knows of files and folders, or their content too.
void dropCaches(const char* which) {
  run("sync");
  std::ofstream file("/proc/sys/vm/drop_caches");
  file << which << std::flush;
  if (!file) giveUp("only root may drop caches, without which there is no cold figure");
}

struct Sizes {
  std::size_t entries = bench::sizeFromEnvironment("YOMBER_BENCH_ITEMS", 100'000);
  std::size_t files = bench::sizeFromEnvironment("YOMBER_BENCH_SMALL_FILES", 10'000);
  std::size_t bytes = bench::sizeFromEnvironment("YOMBER_BENCH_LARGE_BYTES", 1UL << 30U);
  std::size_t rounds = bench::sizeFromEnvironment("YOMBER_BENCH_ROUNDS", 3);
};

/// A folder whose operations are timed.
class Side {
 public:
  /// `waitUntilQuiet` returns when nothing goes on behind the folder.
  Side(std::string folder, const Sizes& sizes, std::function<void()> waitUntilQuiet)
      : folder_(std::move(folder)), sizes_(sizes), waitUntilQuiet_(std::move(waitUntilQuiet)) {}

  /// Seconds, by figure.
  std::map<std::string, double> measure() {
    seconds_.clear();
    waitUntilQuiet_();
    list();
    create();
    waitUntilQuiet_();
    look();
    read();
    rename();
    waitUntilQuiet_();
    readLarge();
    sync();
    fs::remove_all(at("work"));
    return seconds_;
  }
  /// The same, of large reads only.
  std::map<std::string, double> measureLargeReads() {
    seconds_.clear();
    waitUntilQuiet_();
    readLarge();
    return seconds_;
  }

 private:
  [[nodiscard]] std::string at(const std::string& name) const { return folder_ + "/" + name; }
  [[nodiscard]] std::string file(std::size_t number) const {
    return at("work/a/" + std::to_string(number));
  }
  void time(const std::string& figure, const std::function<void()>& work) {
    seconds_[figure] = bench::secondsFor(work);
  }

  void list() {
    const std::string ls = "ls -U '" + at("entries") + "' > /dev/null";
    const std::string find = "find '" + at("entries") + "' -printf '%p %s %T@\\n' > /dev/null";
    dropCaches("2");
    time("ls -U, cold", [&] { run(ls); });
    time("ls -U, warm", [&] { run(ls); });
    dropCaches("2");
    time("find -printf, cold", [&] { run(find); });
    time("find -printf, warm", [&] { run(find); });
  }

  void create() {
    fs::create_directories(at("work/a"));
    fs::create_directories(at("work/b"));
    const std::string content(kBlock, 'x');
    time("create 4 KiB", [&] {
      for (std::size_t i = 0; i < sizes_.files; ++i) {
        const int made = open(file(i).c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644);
        if (write(made, content.data(), content.size()) != ssize_t{kBlock}) giveUp(file(i));
        close(made);
      }
    });
  }

  void look() {
    const auto all = [&] {
      struct stat status{};
      for (std::size_t i = 0; i < sizes_.files; ++i) {
        if (stat(file(i).c_str(), &status) != 0) giveUp(file(i));
      }
    };
    dropCaches("2");
    time("stat, cold", all);
    time("stat, warm", all);
  }

  void read() {
    const auto all = [&] {
      std::string content(kBlock, '\0');
      for (std::size_t i = 0; i < sizes_.files; ++i) {
        const int opened = open(file(i).c_str(), O_RDONLY | O_CLOEXEC);
        if (::read(opened, content.data(), kBlock) != ssize_t{kBlock}) giveUp(file(i));
        close(opened);
      }
    };
    dropCaches("3");
    time("open and read 4 KiB, cold", all);
    time("open and read 4 KiB, warm", all);
  }

  void rename() {
    const auto move = [&](const std::string& from, const std::string& to) {
      for (std::size_t i = 0; i < sizes_.files; ++i) {
        const std::string name = std::to_string(i);
        if (::rename((from + name).c_str(), (to + name).c_str()) != 0) giveUp(from + name);
      }
    };
    time("rename in a folder", [&] { move(at("work/a/"), at("work/a/renamed ")); });
    time("rename across folders", [&] { move(at("work/a/renamed "), at("work/b/")); });
  }

  void readLarge() {
    const std::string cat = "cat '" + at("large") + "' > /dev/null";
    dropCaches("3");
    time("1 GiB, first read", [&] { run(cat); });
    time("1 GiB, second read", [&] { run(cat); });
  }

  void sync() {
    const std::string content(kBlock, 'x');
    time("files written with fsync", [&] {
      for (std::size_t i = 0; i < kSyncedFiles; ++i) {
        const std::string path = at("work/synced " + std::to_string(i));
        const int made = open(path.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0644);
        if (write(made, content.data(), kBlock) != ssize_t{kBlock} || fsync(made) != 0)
          giveUp(path);
        close(made);
      }
    });
  }

  const std::string folder_;
  const Sizes& sizes_;
  const std::function<void()> waitUntilQuiet_;
  std::map<std::string, double> seconds_;
};

/// What every side has: many entries, and a large file.
void fill(const std::string& folder, const Sizes& sizes) {
  fs::create_directories(folder + "/entries");
  bench::makeFiles(folder + "/entries", sizes.entries);
  run("head -c " + std::to_string(sizes.bytes) + " /dev/urandom > '" + folder + "/large'");
}

/// Another program's mount of the native folder.
class Peer {
 public:
  Peer(const std::string& name, const std::string& command, const std::string& folder)
      : folder_(folder) {
    fs::create_directories(folder_);
    if (std::system(("command -v " + name + " > /dev/null").c_str()) != 0) {
      std::printf("%s is not installed (Debian's package): not compared\n", name.c_str());
      return;
    }
    isMounted_ = std::system((command + " '" + folder_ + "'").c_str()) == 0;
    if (isMounted_) (void)testing::eventually([&] { return fs::exists(folder_ + "/large"); });
  }
  ~Peer() {
    if (isMounted_) (void)!std::system(("umount -l '" + folder_ + "'").c_str());
  }
  Peer(const Peer&) = delete;
  Peer& operator=(const Peer&) = delete;
  [[nodiscard]] bool isMounted() const { return isMounted_; }
  [[nodiscard]] const std::string& folder() const { return folder_; }

 private:
  const std::string folder_;
  bool isMounted_ = false;
};

/// The drive once more, as those have it who get no pass-through. Only while it is measured: two
/// mounts are told of every change.
class CachedMount {
 public:
  CachedMount(testing::MountedDrive& drive, const std::string& folder)
      : folder_(folder), process_(command(drive, folder), drive.drive().environment()) {
    if (!testing::eventually([&] { return fs::exists(folder_ + "/large"); }))
      giveUp("the drive cannot be mounted twice");
  }
  ~CachedMount() {
    (void)!std::system(("umount '" + folder_ + "'").c_str());
    (void)process_.waitForEnd();
  }
  CachedMount(const CachedMount&) = delete;
  CachedMount& operator=(const CachedMount&) = delete;

 private:
  static std::vector<std::string> command(testing::MountedDrive& drive, const std::string& folder) {
    fs::create_directories(folder);
    return {testing::programPath("yomber-mount"), "--home", drive.drive().home(),
            "--no-pass-through", folder};
  }

  const std::string folder_;
  testing::LineProcess process_;
};

constexpr const char* kCached = "without pass-through";

struct Goal {
  std::string figure;
  double most = 0;  ///< that the ratio to the native folder may be
};
const std::vector<Goal>& goals() {
  static const std::vector<Goal> all{
      {"ls -U, cold", 1.5},
      {"ls -U, warm", 0.3},
      {"find -printf, cold", 2.5},
      {"find -printf, warm", 0.9},
      {"create 4 KiB", 5},
      {"stat, cold", 4},
      {"stat, warm", 1.2},
      {"open and read 4 KiB, cold", 2.5},
      {"open and read 4 KiB, warm", 6},
      {"rename in a folder", 4},
      {"rename across folders", 4},
      {"1 GiB, first read", 1.05},
      {"1 GiB, second read", 1.05},
      {"files written with fsync", 1 / 0.95},
  };
  return all;
}

bool printMemory(pid_t process) {
  constexpr double kGoal = 40;
  std::ifstream status("/proc/" + std::to_string(process) + "/status");
  bench::Figure figure;
  figure.name = "peak memory of yomber-mount";
  figure.unit = "MiB";
  figure.goal = "at most 40 MiB";
  for (std::string word; status >> word;) {
    if (word == "VmHWM:") status >> figure.value;
  }
  figure.value /= 1024;
  figure.reached = figure.value > 0 && figure.value <= kGoal;
  bench::print(figure);
  return figure.reached;
}

}  // namespace

int main() {
  const Sizes sizes;
  if (geteuid() != 0) giveUp("cold figures need root, who may drop caches");
  testing::MountedDrive drive;
  const fs::path scratch = fs::path(drive.drive().home()).parent_path() / "bench";
  const std::string native = scratch / "native";
  std::fprintf(stderr, "mount_bench: making %zu entries twice\n", sizes.entries);
  fill(native, sizes);
  fill(drive.folder(), sizes);
  const Peer bindfs("bindfs", "bindfs '" + native + "'", scratch / "bindfs");
  const Peer rclone("rclone",
                    "rclone mount --daemon --vfs-cache-mode full --cache-dir '" +
                        (scratch / "cache").string() + "' '" + native + "'",
                    scratch / "rclone");
  std::map<std::string, std::string> sides{{"the mount", drive.folder()}};
  if (bindfs.isMounted()) sides["bindfs"] = bindfs.folder();
  if (rclone.isMounted()) sides["rclone"] = rclone.folder();

  // What is uploaded meanwhile is not what is measured.
  const auto waitUntilUploaded = [&drive] { bench::waitUntilQuiet(drive.drive()); };
  std::map<std::string, std::map<std::string, bench::Repeated>> measured;
  for (std::size_t round = 0; round < sizes.rounds; ++round) {
    std::fprintf(stderr, "mount_bench: round %zu of %zu\n", round + 1, sizes.rounds);
    waitUntilUploaded();
    auto yardstick = Side(native, sizes, [] {}).measure();
    for (const auto& [name, folder] : sides) {
      for (const auto& [figure, seconds] : Side(folder, sizes, waitUntilUploaded).measure()) {
        measured[name][figure].add(seconds, yardstick.at(figure));
      }
    }
    const CachedMount cached(drive, scratch / "cached");
    Side side(scratch / "cached", sizes, waitUntilUploaded);
    for (const auto& [figure, seconds] : side.measureLargeReads()) {
      measured[kCached][figure].add(seconds, yardstick.at(figure));
    }
  }
  bool isReached = true;
  for (const Goal& goal : goals()) {
    for (const auto& [side, folder] : sides) {
      const bool isOurs = side == "the mount";
      char text[64];
      std::snprintf(text, sizeof text, "at most %.3g times", goal.most);
      const auto figure = measured[side][goal.figure].figure(
          side + ": " + goal.figure, "s", "native", isOurs ? text : "",
          [most = goal.most, isOurs](double ratio) { return !isOurs || ratio <= most; });
      bench::print(figure);
      isReached &= figure.reached;
    }
  }
  constexpr double kMostCached = 1.5;
  for (auto& [name, repeated] : measured[kCached]) {
    const auto figure =
        repeated.figure(std::string(kCached) + ": " + name, "s", "native", "at most 1.5 times",
                        [](double ratio) { return ratio <= kMostCached; });
    bench::print(figure);
    isReached &= figure.reached;
  }
  isReached &= printMemory(drive.pid());
  return isReached ? 0 : 1;
}
