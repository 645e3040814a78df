#include "thumbnailer/sandbox.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdint>
#include <functional>
#include <string>
#include <thread>

#include "platform/foundation/sanitized.h"

namespace yomber::thumbnailer {
namespace {

constexpr std::uint64_t kMemory = std::uint64_t{1} << 30;
constexpr std::uint64_t kFileSize = 4096;
constexpr int kTrue = 10;
constexpr int kFalse = 11;

/// What became of a process that gave up its rights and then did this: its exit status, or the
/// signal that ended it as a negative number.
int afterGivingUp(const std::function<bool()>& attempt) {
  const pid_t child = fork();
  if (child == 0) {
    if (!limitRights(kMemory, kFileSize).empty() || !closeDoors().empty()) _exit(1);
    _exit(attempt() ? kTrue : kFalse);
  }
  int status = 0;
  EXPECT_EQ(waitpid(child, &status, 0), child);
  return WIFSIGNALED(status) ? -WTERMSIG(status) : WEXITSTATUS(status);
}

class SandboxTest : public testing::Test {
 protected:
  void SetUp() override {
    if (kIsSanitized) GTEST_SKIP() << "sanitizers need what is given up here";
  }
};

TEST_F(SandboxTest, WhatIsOpenCanBeUsed) {
  EXPECT_EQ(afterGivingUp([file = memfd_create("test", 0)] {
              char byte = 'x';
              struct stat status{};
              return write(file, &byte, 1) == 1 && pread(file, &byte, 1, 0) == 1 &&
                     fstat(file, &status) == 0 && status.st_size == 1;
            }),
            kTrue);
}

TEST_F(SandboxTest, ThreadsAndMemoryAreToBeHad) {
  EXPECT_EQ(afterGivingUp([] {
              bool hasRun = false;
              std::thread([&] { hasRun = true; }).join();
              std::string large(std::size_t{8} << 20, 'x');
              return hasRun && large.back() == 'x';
            }),
            kTrue);
}

TEST_F(SandboxTest, NoFileCanBeOpenedMadeOrRemoved) {
  EXPECT_EQ(afterGivingUp([] { return open("/etc/passwd", O_RDONLY) >= 0; }), kFalse);
  EXPECT_EQ(afterGivingUp([] { return open("/usr/lib", O_RDONLY | O_DIRECTORY) >= 0; }), kFalse);
  EXPECT_EQ(afterGivingUp([] { return open("/tmp", O_TMPFILE | O_RDWR, 0600) >= 0; }), kFalse);
  EXPECT_EQ(afterGivingUp([] { return mkdir("/tmp/yomber-sandbox", 0700) == 0; }), kFalse);
  EXPECT_EQ(afterGivingUp([] { return unlink("/tmp/yomber-sandbox") == 0 || errno == ENOENT; }),
            kFalse);
  EXPECT_EQ(afterGivingUp([] {
              struct stat status{};
              return stat("/etc/passwd", &status) == 0;
            }),
            kFalse);
}

TEST_F(SandboxTest, WhoReachesForTheNetworkOrAnotherProgramIsKilled) {
  EXPECT_EQ(afterGivingUp([] { return socket(AF_INET, SOCK_STREAM, 0) >= 0; }), -SIGSYS);
  EXPECT_EQ(afterGivingUp([] { return socket(AF_UNIX, SOCK_STREAM, 0) >= 0; }), -SIGSYS);
  EXPECT_EQ(afterGivingUp([] { return execl("/bin/true", "true", nullptr) == 0; }), -SIGSYS);
}

TEST_F(SandboxTest, NoOtherProcessIsBegunOrSignalled) {
  EXPECT_EQ(afterGivingUp([] { return fork() >= 0; }), kFalse);
  EXPECT_EQ(afterGivingUp([] { return kill(getppid(), 0) == 0; }), kFalse);
  // Nor by the kernel in our name.
  EXPECT_EQ(afterGivingUp([file = memfd_create("test", 0)] {
              return fcntl(file, F_SETOWN, getpid()) == 0 || fcntl(file, F_SETSIG, SIGKILL) == 0 ||
                     fcntl(file, F_SETFL, O_ASYNC) == 0 || fcntl(file, F_SETLEASE, F_RDLCK) == 0;
            }),
            kFalse);
}

TEST_F(SandboxTest, MemoryAndFilesHaveTheirLimits) {
  EXPECT_EQ(afterGivingUp([] {
              return mmap(nullptr, kMemory, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1,
                          0) != MAP_FAILED;
            }),
            kFalse);
  EXPECT_EQ(afterGivingUp([file = memfd_create("test", 0)] {
              const std::string large(kFileSize + 1, 'x');
              return pwrite(file, large.data(), large.size(), 1) ==
                     static_cast<ssize_t>(large.size());
            }),
            kFalse);
}

TEST_F(SandboxTest, WhoWorksForTooLongIsKilled) {
  const int end = afterGivingUp([] {
    limitProcessor(0);
    std::atomic<bool> isEnough{false};
    while (!isEnough) {
    }
    return true;
  });
  EXPECT_EQ(end, -SIGXCPU);
}

/// Without the filter that closes all doors later.
TEST_F(SandboxTest, BeforeItsDoorsAreClosedOnlyTheMachinesOwnFilesCanBeRead) {
  const pid_t child = fork();
  if (child == 0) {
    if (!limitRights(kMemory, kFileSize).empty()) _exit(1);
    if (open("/etc/passwd", O_RDONLY) < 0) _exit(2);
    if (open("/etc/passwd", O_RDWR) >= 0) _exit(3);
    _exit(open("/proc/self/status", O_RDONLY) >= 0 ? 77 : 0);
  }
  int status = 0;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  ASSERT_TRUE(WIFEXITED(status));
  if (WEXITSTATUS(status) == 3 || WEXITSTATUS(status) == 77)
    GTEST_SKIP() << "this kernel has no landlock";
  EXPECT_EQ(WEXITSTATUS(status), 0);
}

}  // namespace
}  // namespace yomber::thumbnailer
