#pragma once

#include <cstring>
#include <filesystem>
#include <functional>
#include <string>
#include <vector>

#include <fcntl.h>
#include <grp.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "platform/foundation/descriptor_path.h"
#include "platform/foundation/file_descriptor.h"
#include "tests/harness/mounted_drive.h"
#include "tests/harness/parity_bench.h"

namespace yomber::testing {

/// What is done in a folder of the mount, and in one of the disk.
struct Case {
  const char* name;
  std::function<void(Bench&)> run;
};

/// Runs cases on both, and compares what comes of them.
class MountParity : public ::testing::Test {
 protected:
  void SetUp() override {
    std::string pattern =
        (std::filesystem::temp_directory_path() / "yomber-parity-XXXXXX").string();
    ASSERT_NE(mkdtemp(pattern.data()), nullptr);
    native_ = pattern;
    chmod(native_.c_str(), 0755);
    chmod(mounted_.folder().c_str(), 0755);
    umask(022);
  }
  void TearDown() override {
    std::error_code failure;
    std::filesystem::remove_all(native_, failure);
  }

  void compareAsRoot(const std::vector<Case>& cases) {
    if (geteuid() != 0) GTEST_SKIP() << "needs root";
    compare(cases);
  }
  /// In a process that is nobody's where this one is root's.
  void compareAsUser(const std::vector<Case>& cases) {
    if (geteuid() != 0) return compare(cases);
    for (const Case& one : cases) makeFolders(one.name);
    // Nobody cannot reach the drive's tree by its path.
    const FileDescriptor tree(open(mounted_.onDisk("").c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    const pid_t child = fork();
    if (child == 0) {
      int different = becomeNobody() ? 0 : 100;
      for (const Case& one : cases) {
        const std::string mounted =
            outcome(one, mounted_.at(one.name), 0, pathOfDescriptor(tree.get()) + "/" + one.name);
        const std::string native = outcome(one, native_ + "/" + one.name);
        if (mounted == native) continue;
        ++different;
        const std::string text =
            one.name + std::string("\nmounted:\n") + mounted + "native:\n" + native;
        (void)!write(STDERR_FILENO, text.data(), text.size());
      }
      _exit(different);
    }
    int status = -1;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    EXPECT_EQ(status, 0) << "see what was printed";
  }

  MountedDrive mounted_;
  std::string native_;

 private:
  static bool becomeNobody() {
    constexpr uid_t kNobody = 65534;
    return setgroups(0, nullptr) == 0 && setresgid(kNobody, kNobody, kNobody) == 0 &&
           setresuid(kNobody, kNobody, kNobody) == 0;
  }
  static std::string outcome(const Case& one, const std::string& folder, pid_t holder = 0,
                             const std::string& tree = {}) {
    Bench bench(folder, holder, tree);
    one.run(bench);
    return bench.text();
  }
  /// Both for one case, empty, and open to everybody.
  void makeFolders(const std::string& name) {
    for (const std::string& folder : {native_ + "/" + name, mounted_.at(name)}) {
      ASSERT_EQ(mkdir(folder.c_str(), 0777), 0) << folder;
      ASSERT_EQ(chmod(folder.c_str(), 0777), 0) << folder;
    }
  }
  void compare(const std::vector<Case>& cases) {
    for (const Case& one : cases) {
      makeFolders(one.name);
      EXPECT_EQ(outcome(one, mounted_.at(one.name), mounted_.pid(), mounted_.onDisk(one.name)),
                outcome(one, native_ + "/" + one.name))
          << one.name;
    }
  }
};

}  // namespace yomber::testing
