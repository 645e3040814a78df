#include "platform/foundation/tree_removal.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <filesystem>
#include <fstream>
#include <thread>

#include "platform/foundation/file_descriptor.h"
#include "platform/foundation/temporary_directory.h"

namespace yomber {
namespace {

namespace fs = std::filesystem;

class TreeRemovalTest : public testing::Test {
 protected:
  /// Folders in folders, deeper than any path can say.
  void makeDeep(const std::string& top, int depth) const {
    ASSERT_EQ(mkdir((directory_ / top).c_str(), 0700), 0);
    FileDescriptor at(open((directory_ / top).c_str(), O_RDONLY | O_DIRECTORY));
    for (int i = 0; i < depth; ++i) {
      ASSERT_EQ(mkdirat(at.get(), "level", 0700), 0);
      close(openat(at.get(), "file", O_CREAT | O_WRONLY, 0600));
      at = FileDescriptor(openat(at.get(), "level", O_RDONLY | O_DIRECTORY));
    }
  }
  [[nodiscard]] bool exists(const std::string& name) const {
    struct stat status{};
    return lstat((directory_ / name).c_str(), &status) == 0;
  }

  TemporaryDirectory directory_;
};

TEST_F(TreeRemovalTest, RemovesFoldersFarDeeperThanPathsAndDescriptorsReach) {
  makeDeep("deep", 5'000);
  rlimit limit{};
  ASSERT_EQ(getrlimit(RLIMIT_NOFILE, &limit), 0);
  const rlimit few{128, limit.rlim_max};
  ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &few), 0);
  TreeRemoval removal;
  EXPECT_TRUE(removal.run(directory_ / "deep")) << errno << " at " << removal.failedPath().size();
  ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &limit), 0);
  EXPECT_FALSE(exists("deep"));
}

TEST_F(TreeRemovalTest, RemovesManyFoldersBesideEachOther) {
  for (int i = 0; i < 500; ++i) {
    fs::create_directories(directory_ / "wide" + "/" + std::to_string(i) + "/in");
    std::ofstream(directory_ / "wide" + "/" + std::to_string(i) + "/in/file") << "x";
  }
  EXPECT_TRUE(TreeRemoval().run(directory_ / "wide"));
  EXPECT_FALSE(exists("wide"));
}

TEST_F(TreeRemovalTest, RemovesLinksAndNotWhatTheyShow) {
  fs::create_directory(directory_ / "kept");
  std::ofstream(directory_ / "kept" + "/file") << "x";
  fs::create_directory(directory_ / "folder");
  fs::create_directory_symlink(directory_ / "kept", directory_ / "folder" + "/link");
  EXPECT_TRUE(TreeRemoval().run(directory_ / "folder"));
  EXPECT_TRUE(exists("kept/file"));
  fs::create_directory_symlink(directory_ / "kept", directory_ / "link");
  EXPECT_TRUE(TreeRemoval().run(directory_ / "link"));
  EXPECT_TRUE(exists("kept/file"));
  EXPECT_FALSE(exists("link"));
}

TEST_F(TreeRemovalTest, CopesWithFilesThatAppearMeanwhile) {
  fs::create_directories(directory_ / "busy/inner");
  std::atomic<bool> done{false};
  std::atomic<int> made{0};
  std::thread writer([&] {
    for (int i = 0; !done; ++i) {
      const int fd = open((directory_ / "busy/inner/" + std::to_string(i)).c_str(),
                          O_CREAT | O_WRONLY | O_CLOEXEC, 0600);
      if (fd < 0) break;
      close(fd);
      ++made;
    }
  });
  while (made < 50) std::this_thread::yield();
  EXPECT_TRUE(TreeRemoval().run(directory_ / "busy"));
  done = true;
  writer.join();
  EXPECT_FALSE(exists("busy"));
}

TEST_F(TreeRemovalTest, SaysWhatIsNotThere) {
  TreeRemoval removal;
  EXPECT_FALSE(removal.run(directory_ / "nothing"));
  EXPECT_EQ(errno, ENOENT);
  EXPECT_EQ(removal.failedPath(), directory_ / "nothing");
}

TEST_F(TreeRemovalTest, LiftsTheProtectionOfFoldersOnlyWhenAsked) {
  if (geteuid() == 0) {
    ASSERT_EQ(chmod(directory_.path().c_str(), 0777), 0);
    ASSERT_EQ(seteuid(65534), 0);
  }
  for (const char* const name : {"shut", "shut/inner"}) mkdir((directory_ / name).c_str(), 0700);
  close(open((directory_ / "shut/inner/file").c_str(), O_CREAT | O_WRONLY, 0600));
  chmod((directory_ / "shut/inner").c_str(), 0);
  chmod((directory_ / "shut").c_str(), 0500);
  TreeRemoval careful;
  EXPECT_FALSE(careful.run(directory_ / "shut"));
  EXPECT_EQ(errno, EACCES);
  EXPECT_TRUE(TreeRemoval(TreeRemoval::Protection::Lift).run(directory_ / "shut")) << errno;
  EXPECT_FALSE(exists("shut"));
  if (getuid() == 0) {
    ASSERT_EQ(seteuid(0), 0);
  }
}

}  // namespace
}  // namespace yomber
