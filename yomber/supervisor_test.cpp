#include "yomber/supervisor.h"

#include <cerrno>
#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <fstream>

#include <poll.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

extern "C" {
#include <sys/pidfd.h>  // Debian 12's does not say extern "C" itself
}

#include <gtest/gtest.h>

namespace yomber {
namespace {

/// A supervisor in a process of its own, keeping one program that says its pid on a pipe.
class SupervisorTest : public testing::Test {
 protected:
  void SetUp() override {
    std::string pattern = testing::TempDir() + "/supervisor.XXXXXX";
    directory_ = mkdtemp(pattern.data());
    lock_ = directory_ + "/lock";
    pids_ = directory_ + "/pids";
    ASSERT_EQ(mkfifo(pids_.c_str(), 0600), 0);
  }

  void TearDown() override {
    if (supervisor_ > 0) {
      kill(supervisor_, SIGKILL);
      waitpid(supervisor_, nullptr, 0);
    }
    std::filesystem::remove_all(directory_);
  }

  void start(const std::string& script) {
    supervisor_ = fork();
    if (supervisor_ == 0) {
      Supervisor supervisor(lock_, {{"program", {"/bin/sh", "-c", script}}});
      if (supervisor.takeLock()) _exit(73);
      supervisor.run();
      _exit(0);
    }
  }

  /// The script of a program that says its pid and stays.
  [[nodiscard]] std::string stays() const {
    return "echo $$ > " + pids_ + "; exec tail -f /dev/null";
  }

  /// Blocks until a program has said its pid.
  pid_t nextPid() {
    std::ifstream pipe(pids_);
    pid_t pid = 0;
    pipe >> pid;
    return pid;
  }

  static bool hasEnded(int pidDescriptor) {
    pollfd waiting{pidDescriptor, POLLIN, 0};
    return poll(&waiting, 1, 20'000) == 1;
  }

  int endSupervisor(int number) {
    kill(supervisor_, number);
    int status = 0;
    waitpid(supervisor_, &status, 0);
    supervisor_ = -1;
    return status;
  }

  std::string directory_, lock_, pids_;
  pid_t supervisor_ = -1;
};

TEST_F(SupervisorTest, StartsAProgramAgainThatWasKilled) {
  start(stays());
  const pid_t first = nextPid();
  kill(first, SIGKILL);
  const pid_t second = nextPid();
  EXPECT_NE(first, second);
  EXPECT_EQ(kill(second, 0), 0);
}

TEST_F(SupervisorTest, EndsItsProgramsWhenItIsToldToEnd) {
  start(stays());
  const int program = pidfd_open(nextPid(), 0);
  EXPECT_EQ(endSupervisor(SIGTERM), 0);
  EXPECT_TRUE(hasEnded(program));
  close(program);
}

TEST_F(SupervisorTest, TakesItsProgramsAlongWhenItIsKilled) {
  start(stays());
  const int program = pidfd_open(nextPid(), 0);
  EXPECT_EQ(WTERMSIG(endSupervisor(SIGKILL)), SIGKILL);
  EXPECT_TRUE(hasEnded(program));
  close(program);
}

TEST_F(SupervisorTest, IsKnownByItsLockForAsLongAsItLives) {
  EXPECT_EQ(Supervisor::runningPid(lock_), std::nullopt);
  start(stays());
  nextPid();
  EXPECT_EQ(Supervisor::runningPid(lock_), supervisor_);
  endSupervisor(SIGKILL);
  EXPECT_EQ(Supervisor::runningPid(lock_), std::nullopt);
}

TEST_F(SupervisorTest, RefusesToRunBesideAnother) {
  start(stays());
  nextPid();
  Supervisor second(lock_, {});
  const NSErrorRef error = second.takeLock();
  ASSERT_TRUE(error);
  EXPECT_TRUE(error->is(NSPOSIXErrorDomain, EWOULDBLOCK));
}

}  // namespace
}  // namespace yomber
