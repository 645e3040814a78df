#pragma once

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <filesystem>
#include <functional>
#include <string>
#include <system_error>
#include <thread>
#include <vector>

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

namespace yomber::testing {

/// Tries operations in one folder, and writes down what comes of them.
class Bench {
 public:
  /// `holder`: whose descriptors `settle` looks at; 0: nobody keeps a file open after its close.
  explicit Bench(std::string folder, pid_t holder = 0)
      : folder_(std::move(folder)), holder_(holder) {}

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
    const auto start = std::chrono::steady_clock::now();
    while (holder_ != 0 && holds(end)) {
      if (std::chrono::steady_clock::now() - start > std::chrono::minutes(1))
        return say("still open: " + name);
      std::this_thread::yield();
    }
  }

  /// What stat shows of an entry.
  void look(const std::string& name) {
    struct stat status{};
    if (note(("look " + name).c_str(), lstat(at(name).c_str(), &status)) < 0) return;
    say("mode " + std::to_string(status.st_mode) + " links " +
        std::to_string(S_ISDIR(status.st_mode) ? 0 : status.st_nlink) + " size " +
        std::to_string(S_ISDIR(status.st_mode) ? 0 : status.st_size) + " owner " +
        std::to_string(status.st_uid) + ":" + std::to_string(status.st_gid) + " device " +
        std::to_string(status.st_rdev));
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
  std::string text_;
};

}  // namespace yomber::testing
