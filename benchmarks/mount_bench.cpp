// The mount beside the native folder on the same disk, and beside other programs' mounts of that
// folder where they are installed: each figure is a ratio to the native folder, right before or
// after.

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
#include <utility>
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
  /// `work` is for what it makes, and nobody else's: several sides may show the same folder.
  Side(std::string folder, std::string work, const Sizes& sizes)
      : folder_(std::move(folder)), work_(std::move(work)), sizes_(sizes) {}

  /// What is measured one after the other; the later need what the earlier have left.
  using Part = void (Side::*)();
  static const std::vector<Part>& parts() {
    static const std::vector<Part> all{&Side::list,   &Side::create,    &Side::look, &Side::read,
                                       &Side::rename, &Side::readLarge, &Side::sync, &Side::clear};
    return all;
  }
  static Part largeReads() { return &Side::readLarge; }

  void measure(Part part) { (this->*part)(); }
  /// By figure, since the last time.
  std::map<std::string, double> takeSeconds() { return std::exchange(seconds_, {}); }

 private:
  [[nodiscard]] std::string at(const std::string& name) const { return folder_ + "/" + name; }
  [[nodiscard]] std::string inWork(const std::string& name) const { return at(work_ + "/" + name); }
  [[nodiscard]] std::string file(std::size_t number) const {
    return inWork("a/" + std::to_string(number));
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
    fs::create_directories(inWork("a"));
    fs::create_directories(inWork("b"));
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
    time("rename in a folder", [&] { move(inWork("a/"), inWork("a/renamed ")); });
    time("rename across folders", [&] { move(inWork("a/renamed "), inWork("b/")); });
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
        const std::string path = inWork("synced " + std::to_string(i));
        const int made = open(path.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0644);
        if (write(made, content.data(), kBlock) != ssize_t{kBlock} || fsync(made) != 0)
          giveUp(path);
        close(made);
      }
    });
  }

  void clear() { fs::remove_all(at(work_)); }

  const std::string folder_;
  const std::string work_;
  const Sizes& sizes_;
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

constexpr const char* kNative = "native";
constexpr const char* kOurs = "the mount";
constexpr const char* kCached = "without pass-through";

using Sides = std::map<std::string, Side>;
using Measured = std::map<std::string, std::map<std::string, bench::Repeated>>;

/// Measures a part on these sides, one right after the other, since what a disk gives changes from
/// minute to minute. What is uploaded or written back meanwhile is not what is measured.
void measureBeside(testing::MountedDrive& drive, Sides& sides,
                   const std::vector<std::string>& order, Side::Part part, Measured& measured) {
  std::map<std::string, std::map<std::string, double>> seconds;
  for (const std::string& name : order) {
    bench::waitUntilQuiet(drive.drive());
    ::sync();
    sides.at(name).measure(part);
    seconds[name] = sides.at(name).takeSeconds();
  }
  for (const auto& [name, figures] : seconds) {
    if (name == kNative) continue;
    for (const auto& [figure, took] : figures)
      measured[name][figure].add(took, seconds[kNative].at(figure));
  }
}

/// The next time another one is the first: a disk may have less to give the longer it gives.
void takeTurns(std::vector<std::string>& order) { std::ranges::rotate(order, order.begin() + 1); }

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
  Sides sides;
  const auto add = [&](const std::string& name, const std::string& folder) {
    sides.try_emplace(name, folder, "work " + name, sizes);
  };
  add(kNative, native);
  add(kOurs, drive.folder());
  if (bindfs.isMounted()) add("bindfs", bindfs.folder());
  if (rclone.isMounted()) add("rclone", rclone.folder());
  std::vector<std::string> order;
  for (const auto& [name, side] : sides) order.push_back(name);

  Measured measured;
  std::vector<std::string> two{kNative, kCached};
  for (std::size_t round = 0; round < sizes.rounds; ++round) {
    std::fprintf(stderr, "mount_bench: round %zu of %zu\n", round + 1, sizes.rounds);
    for (const Side::Part part : Side::parts()) {
      measureBeside(drive, sides, order, part, measured);
    }
    takeTurns(order);
    const CachedMount cached(drive, scratch / "cached");
    sides.erase(kCached);
    sides.try_emplace(kCached, scratch / "cached", "work cached", sizes);
    measureBeside(drive, sides, two, Side::largeReads(), measured);
    takeTurns(two);
  }
  bool isReached = true;
  for (const Goal& goal : goals()) {
    for (const auto& [side, measuredThere] : sides) {
      if (side == kNative || side == kCached) continue;
      const bool isOurs = side == kOurs;
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
  for (const auto& [name, repeated] : measured[kCached]) {
    const auto figure =
        repeated.figure(std::string(kCached) + ": " + name, "s", "native", "at most 1.5 times",
                        [](double ratio) { return ratio <= kMostCached; });
    bench::print(figure);
    isReached &= figure.reached;
  }
  isReached &= printMemory(drive.pid());
  return isReached ? 0 : 1;
}
