#include "zarn/lent_mode.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <csignal>
#include <filesystem>
#include <fstream>
#include <functional>

#include "platform/foundation/fault_points.h"
#include "platform/foundation/temporary_directory.h"
#include "zarn/file_descriptor.h"
#include "zarn/item_attributes.h"

namespace yomber {
namespace {

/// A user for whom modes count, other than root.
constexpr uid_t kSomebody = 65534;

class LentModeTest : public testing::Test {
 protected:
  LentModeTest() {
    std::ofstream(file_) << "text";
    EXPECT_EQ(chmod(file_.c_str(), 0444), 0);
    if (geteuid() != 0) return;
    for (const std::string& path : {directory_.path(), file_}) {
      EXPECT_EQ(chown(path.c_str(), kSomebody, kSomebody), 0);
    }
  }
  ~LentModeTest() override { setLentModesFolder({}); }

  /// Runs `action` as somebody who is not root, in a process of its own; answers its wait status.
  static int asSomebody(const std::function<int()>& action) {
    const pid_t child = fork();
    if (child == 0) {
      const bool isDropped = geteuid() != 0 || (setresgid(kSomebody, kSomebody, kSomebody) == 0 &&
                                                setresuid(kSomebody, kSomebody, kSomebody) == 0);
      _exit(isDropped ? action() : 99);
    }
    int status = -1;
    EXPECT_EQ(waitpid(child, &status, 0), child);
    return status;
  }
  int tag() const {
    setLentModesFolder(notes_);
    const FileDescriptor folder(open(directory_.path().c_str(), O_RDONLY | O_DIRECTORY));
    struct stat status{};
    if (!folder || stat(file_.c_str(), &status) != 0) return 98;
    return writeItemAttribute(folder.get(), "file", status.st_ino, kTagsAttribute, "blue");
  }
  [[nodiscard]] mode_t mode() const {
    struct stat status{};
    EXPECT_EQ(stat(file_.c_str(), &status), 0);
    return status.st_mode & 07777U;
  }
  [[nodiscard]] std::string tags() const {
    std::string value(64, '\0');
    const ssize_t size = getxattr(file_.c_str(), kTagsAttribute, value.data(), value.size());
    value.resize(size > 0 ? static_cast<std::size_t>(size) : 0);
    return value;
  }
  [[nodiscard]] std::size_t noteCount() const {
    std::error_code failure;
    const std::filesystem::directory_iterator notes(notes_, failure);
    return failure ? 0 : static_cast<std::size_t>(std::distance(begin(notes), end(notes)));
  }

  const TemporaryDirectory directory_;
  const std::string file_ = directory_.path() + "/file";
  const std::string notes_ = directory_.path() + "/notes";
};

TEST_F(LentModeTest, AFileThatMayOnlyBeReadTakesAttributesAndStaysAsItIs) {
  EXPECT_EQ(asSomebody([&] { return tag(); }), 0);
  EXPECT_EQ(tags(), "blue");
  EXPECT_EQ(mode(), 0444U);
  EXPECT_EQ(noteCount(), 0U);
}

TEST_F(LentModeTest, ACrashLeavesNothingWritableForGood) {
  const int status = asSomebody([&] {
    (void)FaultPoint::arm("zarn.mode.lent=abort");
    return tag();
  });
  ASSERT_TRUE(WIFSIGNALED(status) || WEXITSTATUS(status) != 0) << status;
  EXPECT_EQ(mode(), 0644U) << "it did not end where it was to";
  EXPECT_EQ(noteCount(), 1U);
  EXPECT_EQ(asSomebody([&] {
              setLentModesFolder(notes_);
              restoreLentModes();
              return 0;
            }),
            0);
  EXPECT_EQ(mode(), 0444U);
  EXPECT_EQ(noteCount(), 0U);
}

TEST_F(LentModeTest, AModeThatSomebodySetMeanwhileStays) {
  EXPECT_EQ(asSomebody([&] {
              setLentModesFolder(notes_);
              const FileDescriptor file(open(file_.c_str(), O_PATH | O_CLOEXEC));
              const auto lent = LentMode::lend(file.get());
              return lent && chmod(file_.c_str(), 0600) == 0 ? 0 : 1;
            }),
            0);
  EXPECT_EQ(mode(), 0600U);
}

TEST_F(LentModeTest, WhatIsWritableIsNotLent) {
  EXPECT_EQ(asSomebody([&] {
              (void)chmod(file_.c_str(), 0600);
              const FileDescriptor file(open(file_.c_str(), O_PATH | O_CLOEXEC));
              return LentMode::lend(file.get()) ? 1 : 0;
            }),
            0);
}

}  // namespace
}  // namespace yomber
