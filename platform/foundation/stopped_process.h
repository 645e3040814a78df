#pragma once

#include <signal.h>
#include <sys/types.h>

#include <chrono>
#include <cstddef>
#include <filesystem>
#include <fstream>
#include <string>
#include <system_error>
#include <thread>

namespace yomber {

/// For tests: a process that has stopped, until the object goes.
class StoppedProcess {
 public:
  /// Returns when every thread of it stands still, or it is gone: each goes on until one has taken
  /// the signal.
  explicit StoppedProcess(pid_t process) : process_(process) {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(60);
    ::kill(process_, SIGSTOP);
    while (!standsStill() && std::chrono::steady_clock::now() < deadline) {
      std::this_thread::yield();
    }
  }
  ~StoppedProcess() { ::kill(process_, SIGCONT); }
  StoppedProcess(const StoppedProcess&) = delete;
  StoppedProcess& operator=(const StoppedProcess&) = delete;

 private:
  [[nodiscard]] bool standsStill() const {
    std::error_code gone;
    const std::string threads = "/proc/" + std::to_string(process_) + "/task";
    for (const auto& thread : std::filesystem::directory_iterator(threads, gone)) {
      std::ifstream status(thread.path() / "stat");
      std::string line;
      std::getline(status, line);
      const std::size_t name = line.rfind(')');
      if (name != std::string::npos && line.compare(name, 3, ") T") != 0) return false;
    }
    return true;
  }

  const pid_t process_;
};

}  // namespace yomber
