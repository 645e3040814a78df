#pragma once

#include <csignal>
#include <filesystem>
#include <fstream>
#include <string>
#include <system_error>

#include <sys/types.h>

#include <gtest/gtest.h>

#include "tests/harness/child_process.h"

namespace yomber::testing {

/// A process that has stopped, until the object goes.
class StoppedProcess {
 public:
  /// Returns when every thread of it stands still: each goes on until one has taken the signal.
  explicit StoppedProcess(pid_t process) : process_(process) {
    ::kill(process_, SIGSTOP);
    EXPECT_TRUE(eventually([this] { return hasStopped(); }));
  }
  ~StoppedProcess() { ::kill(process_, SIGCONT); }
  StoppedProcess(const StoppedProcess&) = delete;
  StoppedProcess& operator=(const StoppedProcess&) = delete;

 private:
  [[nodiscard]] bool hasStopped() const {
    std::error_code gone;
    const std::string threads = "/proc/" + std::to_string(process_) + "/task";
    for (const auto& thread : std::filesystem::directory_iterator(threads, gone)) {
      std::string line;
      std::getline(std::ifstream(thread.path() / "stat"), line);
      const std::size_t name = line.rfind(')');
      if (name != std::string::npos && line.compare(name, 3, ") T") != 0) return false;
    }
    return !gone;
  }

  const pid_t process_;
};

}  // namespace yomber::testing
