#pragma once

#include <atomic>
#include <cerrno>
#include <fstream>
#include <functional>
#include <string>
#include <thread>
#include <utility>

#include <unistd.h>

namespace yomber::testing {

/// A system call beside the test, which may wait for the mount.
class Aside {
 public:
  explicit Aside(std::function<int()> call)
      : thread_([this, call = std::move(call)] {
          threadNumber_ = gettid();
          result_ = call() < 0 ? errno : 0;
          isDone_ = true;
        }) {}
  ~Aside() {
    if (thread_.joinable()) thread_.join();
  }
  Aside(const Aside&) = delete;
  Aside& operator=(const Aside&) = delete;

  /// Its errno, or 0, when it is done.
  [[nodiscard]] int result() {
    thread_.join();
    return result_;
  }
  [[nodiscard]] bool isDone() const { return isDone_; }
  /// Whether it is done, or waits for an answer.
  [[nodiscard]] bool isAsked() const {
    std::ifstream stack("/proc/self/task/" + std::to_string(threadNumber_) + "/wchan");
    std::string where;
    stack >> where;
    const auto isIn = [&](const char* what) { return where.find(what) != std::string::npos; };
    // The last: of a map's page.
    return isDone_ || isIn("fuse") || isIn("request") || isIn("folio");
  }

 private:
  std::atomic<pid_t> threadNumber_ = 0;
  int result_ = -1;
  std::atomic<bool> isDone_ = false;
  std::thread thread_;
};

}  // namespace yomber::testing
