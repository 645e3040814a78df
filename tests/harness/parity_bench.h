#pragma once

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <functional>
#include <map>
#include <string>
#include <system_error>
#include <thread>
#include <vector>

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include "zarn/item_attributes.h"

namespace yomber::testing {

/// Tries operations in one folder, and writes down what comes of them.
class Bench {
 public:
  /// `holder`: whose descriptors `settle` looks at; 0: nobody keeps a file open after its close.
  /// `tree`: where the drive has that folder on the disk; empty: it is no drive's.
  explicit Bench(std::string folder, pid_t holder = 0, std::string tree = {})
      : folder_(std::move(folder)), holder_(holder), tree_(std::move(tree)) {}

  [[nodiscard]] std::string at(const std::string& name) const { return folder_ + "/" + name; }
  [[nodiscard]] const std::string& text() const { return text_; }

  /// An answer of the system; the error's name when it is one.
  long note(const char* what, long answer) {
    text_ += std::string(what) + ": " +
             (answer < 0 ? strerrorname_np(errno) : std::to_string(answer)) + "\n";
    return answer;
  }
  void say(const std::string& line) { text_ += line + "\n"; }

  /// Waits until the mount, too, has closed a file that is closed here: the kernel tells it
  /// later, and as long as it has one open, who opens it joins in.
  void settle(const std::string& name) {
    const std::string end = std::filesystem::path(folder_).filename().string() + "/" + name;
    waitUntil("still open: " + name, [&] { return holder_ == 0 || !holds(end); });
  }

  /// What stat shows of an entry.
  void look(const std::string& name) {
    struct stat status{};
    if (note(("look " + name).c_str(), lstat(at(name).c_str(), &status)) < 0) return;
    say("mode " + std::to_string(status.st_mode) + " links " + std::to_string(status.st_nlink) +
        " size " + std::to_string(status.st_size) + " blocks " + std::to_string(status.st_blocks) +
        " owner " + std::to_string(status.st_uid) + ":" + std::to_string(status.st_gid) +
        " device " + std::to_string(status.st_rdev));
  }
  /// Which dates of these entries an operation changes. All are long past before it, but for those
  /// of the status, since when the clock has moved on. The drive's own change of the status, when
  /// it gives a new item its identifier, is waited for.
  void dates(const char* what, const std::vector<std::string>& names,
             const std::function<long()>& operation) {
    constexpr timespec kPast{.tv_sec = 1'000'000, .tv_nsec = 0};
    const timespec times[2]{kPast, kPast};
    std::map<std::string, struct stat> before;
    for (const std::string& name : names) {
      waitUntil("without an identifier: " + name, [&] { return tree_.empty() || isSettled(name); });
      struct stat status{};
      if (utimensat(AT_FDCWD, at(name).c_str(), times, AT_SYMLINK_NOFOLLOW) == 0 &&
          lstat(at(name).c_str(), &status) == 0) {
        before[name] = status;
      }
    }
    for (const auto& [name, status] : before) waitForClock(status.st_ctim);
    note(what, std::min(operation(), 0L));
    for (const std::string& name : names) {
      struct stat status{};
      const bool isThere = lstat(at(name).c_str(), &status) == 0;
      std::string line = "  " + name + (isThere ? "" : " is not there");
      const auto tell = [&](const char* date, timespec stat::* which) {
        const auto& was = before.contains(name) ? before[name].*which : timespec{};
        const auto& now = status.*which;
        const bool isLater =
            now.tv_sec > was.tv_sec || (now.tv_sec == was.tv_sec && now.tv_nsec > was.tv_nsec);
        const bool isSame = now.tv_sec == was.tv_sec && now.tv_nsec == was.tv_nsec;
        line += std::string(" ") + date + (isLater ? " later" : isSame ? " same" : " earlier");
      };
      if (isThere) {
        tell("atime", &stat::st_atim);
        tell("mtime", &stat::st_mtim);
        tell("ctime", &stat::st_ctim);
      }
      say(line);
    }
  }
  int file(const std::string& name, const std::string& content = "", mode_t mode = 0644) {
    const int descriptor = open(at(name).c_str(), O_RDWR | O_CREAT | O_TRUNC | O_CLOEXEC, mode);
    if (note(("make " + name).c_str(), descriptor < 0 ? -1 : 0) < 0) return -1;
    note("write", write(descriptor, content.data(), content.size()));
    return descriptor;
  }
  void made(const std::string& name, const std::string& content = "", mode_t mode = 0644) {
    close(file(name, content, mode));
  }
  void content(const std::string& name) {
    const int descriptor = open(at(name).c_str(), O_RDONLY | O_CLOEXEC);
    if (note(("read " + name).c_str(), descriptor < 0 ? -1 : 0) < 0) return;
    std::string bytes(1 << 16, '\0');
    bytes.resize(static_cast<std::size_t>(
        std::max<ssize_t>(read(descriptor, bytes.data(), bytes.size()), 0)));
    say("content " + std::to_string(bytes.size()) + " " +
        std::to_string(std::hash<std::string>()(bytes)));
    close(descriptor);
  }
  void names(const std::string& name) {
    std::vector<std::string> all;
    std::error_code failure;
    for (const auto& entry : std::filesystem::directory_iterator(at(name), failure)) {
      all.push_back(entry.path().filename());
    }
    std::ranges::sort(all);
    say("names: " + failure.message());
    for (const auto& one : all) say("  " + one);
  }

 private:
  void waitUntil(const std::string& otherwise, const std::function<bool()>& condition) {
    const auto start = std::chrono::steady_clock::now();
    while (!condition()) {
      if (std::chrono::steady_clock::now() - start > std::chrono::minutes(1)) return say(otherwise);
      std::this_thread::yield();
    }
  }
  /// Not there, or known to the drive.
  [[nodiscard]] bool isSettled(const std::string& name) const {
    return getxattr((tree_ + "/" + name).c_str(), kIDAttribute, nullptr, 0) > 0 || errno == ENOENT;
  }
  /// Until the clock that file systems take dates from is past that.
  static void waitForClock(const timespec& date) {
    timespec now{};
    do {
      clock_gettime(CLOCK_REALTIME_COARSE, &now);
    } while (now.tv_sec < date.tv_sec ||
             (now.tv_sec == date.tv_sec && now.tv_nsec <= date.tv_nsec));
  }
  [[nodiscard]] bool holds(const std::string& end) const {
    std::error_code failure;
    const auto descriptors =
        std::filesystem::directory_iterator("/proc/" + std::to_string(holder_) + "/fd");
    return std::any_of(
        begin(descriptors), std::filesystem::directory_iterator(), [&](const auto& entry) {
          return std::filesystem::read_symlink(entry, failure).string().ends_with(end);
        });
  }

  const std::string folder_;
  const pid_t holder_;
  const std::string tree_;
  std::string text_;
};

}  // namespace yomber::testing
