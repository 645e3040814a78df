#include "platform/foundation/tree_copy.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <chrono>
#include <csignal>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <thread>

#include "platform/foundation/fault_attributes.h"
#include "platform/foundation/file_descriptor.h"
#include "platform/foundation/file_manager.h"
#include "platform/foundation/temporary_directory.h"
#include "platform/foundation/tree_removal.h"

namespace yomber {
namespace {

namespace fs = std::filesystem;
using Identity = TreeCopy::Identity;

class TreeCopyTest : public testing::Test {
 protected:
  [[nodiscard]] std::string at(const std::string& name) const { return directory_ / name; }
  void put(const std::string& name, const std::string& bytes) const {
    std::ofstream(at(name), std::ios::binary) << bytes;
  }
  [[nodiscard]] std::string get(const std::string& name) const {
    std::ifstream file(at(name), std::ios::binary);
    return {std::istreambuf_iterator<char>(file), {}};
  }
  void mark(const std::string& name, const char* attribute, const std::string& value) const {
    ASSERT_EQ(lsetxattr(at(name).c_str(), attribute, value.data(), value.size(), 0), 0);
  }
  [[nodiscard]] std::string attribute(const std::string& name, const char* attribute) const {
    return NSFileManager::defaultManager()
        .extendedAttribute(at(name), attribute)
        .value_or("(none)");
  }
  [[nodiscard]] struct stat status(const std::string& name) const {
    struct stat found{};
    EXPECT_EQ(lstat(at(name).c_str(), &found), 0) << name;
    return found;
  }
  void setTimes(const std::string& name, std::int64_t accessed, std::int64_t modified) const {
    const std::array<std::timespec, 2> times{std::timespec{accessed, 123'456'789},
                                             std::timespec{modified, 987'654'321}};
    ASSERT_EQ(utimensat(AT_FDCWD, at(name).c_str(), times.data(), AT_SYMLINK_NOFOLLOW), 0);
  }
  void expectSameDates(const std::string& left, const std::string& right) const {
    EXPECT_EQ(status(left).st_mtim.tv_sec, status(right).st_mtim.tv_sec);
    EXPECT_EQ(status(left).st_mtim.tv_nsec, status(right).st_mtim.tv_nsec);
  }
  NSErrorRef copy(const std::string& from, const std::string& to,
                  Identity identity = Identity::New) const {
    return TreeCopy(identity).run(at(from), at(to));
  }

  TemporaryDirectory directory_;
};

TEST_F(TreeCopyTest, WaitsForContentThatIsJustBeingChangedUnderALease) {
  put("file", "old");
  const FileDescriptor file(open(at("file").c_str(), O_RDWR | O_CLOEXEC));
  ASSERT_EQ(fcntl(file.get(), F_SETSIG, SIGURG), 0);
  if (fcntl(file.get(), F_SETLEASE, F_WRLCK) != 0) GTEST_SKIP() << "no leases on this file system";
  std::thread copier([&] { EXPECT_EQ(copy("file", "copy"), nullptr); });
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(20);
  while (fcntl(file.get(), F_GETLEASE) == F_WRLCK && std::chrono::steady_clock::now() < deadline) {
    std::this_thread::yield();
  }
  EXPECT_EQ(fcntl(file.get(), F_GETLEASE), F_RDLCK);
  EXPECT_EQ(pwrite(file.get(), "new", 3, 0), 3);
  EXPECT_EQ(fcntl(file.get(), F_SETLEASE, F_UNLCK), 0);
  copier.join();
  EXPECT_EQ(get("copy"), "new");
}

TEST_F(TreeCopyTest, CopiesContentModeDatesAndAttributes) {
  put("source", "some bytes");
  mark("source", "user.xdg.tags", "red,blue");
  chmod(at("source").c_str(), 0640);
  setTimes("source", 1'000'000, 2'000'000);
  EXPECT_EQ(copy("source", "copy"), nullptr);
  EXPECT_EQ(status("copy").st_atim.tv_sec, 1'000'000);
  EXPECT_EQ(status("copy").st_atim.tv_nsec, 123'456'789);
  EXPECT_EQ(get("copy"), "some bytes");
  EXPECT_EQ(attribute("copy", "user.xdg.tags"), "red,blue");
  EXPECT_EQ(status("copy").st_mode, status("source").st_mode);
  expectSameDates("source", "copy");
}

TEST_F(TreeCopyTest, LeavesTheIdentityBehindUnlessItIsAMove) {
  put("source", "x");
  mark("source", "user.yomber.id", "42");
  EXPECT_EQ(copy("source", "copy"), nullptr);
  EXPECT_EQ(attribute("copy", "user.yomber.id"), "(none)");
  EXPECT_EQ(copy("source", "moved", Identity::Kept), nullptr);
  EXPECT_EQ(attribute("moved", "user.yomber.id"), "42");
}

TEST_F(TreeCopyTest, KeepsHoles) {
  const int fd = open(at("sparse").c_str(), O_CREAT | O_WRONLY | O_CLOEXEC, 0600);
  constexpr off_t kSize = 4 << 20;
  ASSERT_EQ(ftruncate(fd, kSize), 0);
  ASSERT_EQ(pwrite(fd, "begin", 5, 0), 5);
  ASSERT_EQ(pwrite(fd, "middle", 6, 2 << 20), 6);
  close(fd);
  EXPECT_EQ(copy("sparse", "copy"), nullptr);
  EXPECT_EQ(status("copy").st_size, kSize);
  EXPECT_LE(status("copy").st_blocks, status("sparse").st_blocks + 16);
  EXPECT_EQ(get("copy"), get("sparse"));
}

TEST_F(TreeCopyTest, CopiesWhatEndsInAHole) {
  put("source", "data");
  ASSERT_EQ(truncate(at("source").c_str(), 1 << 20), 0);
  EXPECT_EQ(copy("source", "copy"), nullptr);
  EXPECT_EQ(status("copy").st_size, 1 << 20);
  EXPECT_EQ(get("copy"), get("source"));
}

TEST_F(TreeCopyTest, CopiesFoldersWithAllThatIsInThem) {
  fs::create_directories(at("source/inner/empty"));
  put("source/inner/file", "deep");
  put("source/\xff\xfe name\n", "odd");
  fs::create_symlink("nowhere/at all", at("source/link"));
  fs::create_hard_link(at("source/inner/file"), at("source/second name"));
  setTimes("source/link", 5, 6);
  setTimes("source/inner", 7, 8);
  mark("source/inner", "user.note", "kept");
  EXPECT_EQ(copy("source", "copy"), nullptr);
  EXPECT_EQ(get("copy/inner/file"), "deep");
  EXPECT_EQ(get("copy/\xff\xfe name\n"), "odd");
  EXPECT_EQ(fs::read_symlink(at("copy/link")), "nowhere/at all");
  EXPECT_TRUE(fs::is_empty(at("copy/inner/empty")));
  EXPECT_EQ(status("copy/inner/file").st_nlink, 1U) << "every name is a file of its own";
  EXPECT_EQ(attribute("copy/inner", "user.note"), "kept");
  for (const char* const name : {"/link", "/inner", ""}) {
    expectSameDates(std::string("source") + name, std::string("copy") + name);
  }
}

TEST_F(TreeCopyTest, CopiesFoldersDeeperThanPathsReach) {
  ASSERT_EQ(mkdir(at("deep").c_str(), 0700), 0);
  constexpr int kDepth = 1'500;
  {
    FileDescriptor level(open(at("deep").c_str(), O_RDONLY | O_DIRECTORY));
    for (int i = 0; i < kDepth; ++i) {
      ASSERT_EQ(mkdirat(level.get(), "level", 0700), 0);
      level = FileDescriptor(openat(level.get(), "level", O_RDONLY | O_DIRECTORY));
    }
    close(openat(level.get(), "end", O_CREAT | O_WRONLY, 0600));
  }
  EXPECT_EQ(copy("deep", "copy"), nullptr);
  FileDescriptor level(open(at("copy").c_str(), O_RDONLY | O_DIRECTORY));
  for (int i = 0; i < kDepth; ++i) {
    level = FileDescriptor(openat(level.get(), "level", O_RDONLY | O_DIRECTORY));
    ASSERT_TRUE(level) << i;
  }
  EXPECT_EQ(faccessat(level.get(), "end", F_OK, 0), 0);
  level = FileDescriptor();
  EXPECT_TRUE(TreeRemoval().run(at("deep")));
  EXPECT_TRUE(TreeRemoval().run(at("copy")));
}

TEST_F(TreeCopyTest, HoldsBackTheModeOfAFolderThatCouldNotBeMoved) {
  fs::create_directory(at("source"));
  put("source/file", "x");
  chmod(at("source").c_str(), 0555);
  TreeCopy copy(Identity::New);
  EXPECT_EQ(copy.run(at("source"), at("copy")), nullptr);
  EXPECT_EQ(status("copy").st_mode & 07777U, 0755U);
  EXPECT_EQ(copy.pendingMode(), 0555U);
}

TEST_F(TreeCopyTest, NeverTakesHolesForContentThatIsElsewhere) {
  fs::create_directory(at("folder"));
  put("folder/fault", "beginning");
  mark("folder/fault", kFaultAttribute, "what the daemon needs");
  const NSErrorRef error = copy("folder", "copy");
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSUbiquitousFileUnavailableError));
  EXPECT_EQ(std::get<std::string>(error->userInfo().at(NSFilePathErrorKey)), at("folder/fault"));
  EXPECT_EQ(copy("folder/fault", "moved", Identity::Kept), nullptr);
  EXPECT_EQ(attribute("moved", kFaultAttribute), "what the daemon needs");
  mark("folder/fault", kFilledAttribute, bootIdentifier());
  EXPECT_EQ(copy("folder/fault", "filled"), nullptr) << "filled in this boot is readable";
  EXPECT_EQ(attribute("filled", kFaultAttribute), "(none)");
}

TEST_F(TreeCopyTest, RefusesPipesWithoutWaitingForAWriter) {
  ASSERT_EQ(mkfifo(at("pipe").c_str(), 0600), 0);
  const NSErrorRef error = copy("pipe", "copy");
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(NSPOSIXErrorDomain, EINVAL));
  fs::create_directory(at("folder"));
  ASSERT_EQ(mkfifo(at("folder/pipe").c_str(), 0600), 0);
  const NSErrorRef inside = copy("folder", "copy");
  ASSERT_NE(inside, nullptr);
  EXPECT_EQ(inside->localizedDescription(),
            at("folder/pipe") + " is neither a file, a folder nor a link");
}

TEST_F(TreeCopyTest, NeverCopiesAFolderIntoItself) {
  fs::create_directories(at("folder/inner"));
  const NSErrorRef error = copy("folder", "folder/inner/copy");
  ASSERT_NE(error, nullptr);
  EXPECT_EQ(error->localizedDescription(),
            at("folder/inner/copy") + " cannot be copied into itself");
}

TEST_F(TreeCopyTest, SaysWhatIsNotThereAndNeverReplaces) {
  EXPECT_TRUE(copy("nothing", "copy")->is(NSPOSIXErrorDomain, ENOENT));
  put("source", "x");
  put("taken", "kept");
  EXPECT_TRUE(copy("source", "taken")->is(NSPOSIXErrorDomain, EEXIST));
  EXPECT_EQ(get("taken"), "kept");
}

}  // namespace
}  // namespace yomber
