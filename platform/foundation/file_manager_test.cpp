#include "platform/foundation/file_manager.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <fstream>

#include "platform/foundation/temporary_directory.h"
#include "platform/foundation/url.h"

namespace yomber {
namespace {

using Intermediates = NSFileManager::Intermediates;

/// Gives up root's privileges for a scope.
class OrdinaryUser {
 public:
  OrdinaryUser() {
    if (geteuid() == 0) {
      EXPECT_EQ(seteuid(65534), 0);
    }
  }
  ~OrdinaryUser() {
    if (getuid() == 0) {
      EXPECT_EQ(seteuid(0), 0);
    }
  }
  OrdinaryUser(const OrdinaryUser&) = delete;
  OrdinaryUser& operator=(const OrdinaryUser&) = delete;
};

class FileManagerTest : public testing::Test {
 protected:
  void put(const std::string& name, const std::string& bytes = "x") {
    std::ofstream(directory_ / name) << bytes;
  }
  std::string get(const std::string& name) {
    std::ifstream file(directory_ / name);
    return {std::istreambuf_iterator<char>(file), {}};
  }
  void makeDirectory(const std::string& name) {
    ASSERT_TRUE(files_.createDirectoryAtPath(directory_ / name, Intermediates::Make));
  }
  /// The last stored error is this one and names the path.
  void expectError(const char* domain, std::int64_t code, const std::string& name) {
    ASSERT_NE(error_, nullptr);
    EXPECT_TRUE(error_->is(domain, code)) << error_->description();
    EXPECT_EQ(std::get<std::string>(error_->userInfo().at(NSFilePathErrorKey)), directory_ / name);
  }

  NSFileManager& files_ = NSFileManager::defaultManager();
  TemporaryDirectory directory_;
  NSErrorRef error_;
};

TEST_F(FileManagerTest, TellsWhatExists) {
  put("file");
  ASSERT_EQ(symlink("nowhere", (directory_ / "dangling").c_str()), 0);
  EXPECT_TRUE(files_.fileExistsAtPath(directory_ / "file"));
  EXPECT_FALSE(files_.fileExistsAtPath(directory_ / "dangling"));
  EXPECT_FALSE(files_.isDirectoryAtPath(directory_ / "file"));
  EXPECT_TRUE(files_.isDirectoryAtPath(directory_.path()));
}

TEST_F(FileManagerTest, MakesDirectoriesWithTheirIntermediatesOnlyWhenAsked) {
  EXPECT_FALSE(files_.createDirectoryAtPath(directory_ / "a/b/c", Intermediates::Require, &error_));
  expectError(NSCocoaErrorDomain, NSFileNoSuchFileError, "a/b/c");
  EXPECT_TRUE(files_.createDirectoryAtPath(directory_ / "a/b/c", Intermediates::Make, &error_));
  EXPECT_TRUE(files_.isDirectoryAtPath(directory_ / "a/b/c"));
  EXPECT_TRUE(files_.createDirectoryAtPath(directory_ / "a/b/c", Intermediates::Make, &error_));
}

TEST_F(FileManagerTest, RefusesADirectoryWhereSomethingIs) {
  makeDirectory("a");
  put("file");
  EXPECT_FALSE(files_.createDirectoryAtPath(directory_ / "a", Intermediates::Require, &error_));
  expectError(NSCocoaErrorDomain, NSFileWriteFileExistsError, "a");
  EXPECT_FALSE(files_.createDirectoryAtPath(directory_ / "file", Intermediates::Make, &error_));
  expectError(NSCocoaErrorDomain, NSFileWriteFileExistsError, "file");
}

TEST_F(FileManagerTest, RemovesFilesLinksAndWholeTrees) {
  makeDirectory("tree/a/b/c");
  makeDirectory("kept");
  put("kept/file");
  for (int i = 0; i < 500; ++i) put("tree/a/" + std::to_string(i));
  ASSERT_EQ(symlink((directory_ / "kept").c_str(), (directory_ / "tree/a/link").c_str()), 0);
  EXPECT_TRUE(files_.removeItemAtPath(directory_ / "tree", &error_));
  EXPECT_FALSE(files_.fileExistsAtPath(directory_ / "tree"));
  EXPECT_TRUE(files_.fileExistsAtPath(directory_ / "kept/file")) << "links are not followed";
  ASSERT_EQ(symlink("kept", (directory_ / "link").c_str()), 0);
  EXPECT_TRUE(files_.removeItemAtPath(directory_ / "link", &error_));
  EXPECT_TRUE(files_.fileExistsAtPath(directory_ / "kept/file"));
}

TEST_F(FileManagerTest, SaysWhatCouldNotBeRemoved) {
  EXPECT_FALSE(files_.removeItemAtPath(directory_ / "missing", &error_));
  expectError(NSCocoaErrorDomain, NSFileNoSuchFileError, "missing");
  ASSERT_EQ(chmod(directory_.path().c_str(), 0777), 0);
  const OrdinaryUser user;  // root could remove everything
  makeDirectory("tree/closed");
  put("tree/closed/file");
  ASSERT_EQ(chmod((directory_ / "tree/closed").c_str(), 0500), 0);
  EXPECT_FALSE(files_.removeItemAtPath(directory_ / "tree", &error_));
  expectError(NSPOSIXErrorDomain, EACCES, "tree/closed/file");
  ASSERT_EQ(chmod((directory_ / "tree/closed").c_str(), 0700), 0);
}

TEST_F(FileManagerTest, MovesWithoutEverReplacing) {
  put("a", "one");
  put("b", "two");
  EXPECT_FALSE(files_.moveItemAtPath(directory_ / "a", directory_ / "b", &error_));
  expectError(NSCocoaErrorDomain, NSFileWriteFileExistsError, "b");
  EXPECT_EQ(get("a") + get("b"), "onetwo");
  EXPECT_TRUE(files_.moveItemAtPath(directory_ / "a", directory_ / "c", &error_));
  EXPECT_EQ(get("c"), "one");
  EXPECT_FALSE(files_.fileExistsAtPath(directory_ / "a"));
}

TEST_F(FileManagerTest, SaysWhichEndOfAMoveIsMissing) {
  put("a");
  EXPECT_FALSE(files_.moveItemAtPath(directory_ / "missing", directory_ / "b", &error_));
  expectError(NSCocoaErrorDomain, NSFileNoSuchFileError, "missing");
  EXPECT_FALSE(files_.moveItemAtPath(directory_ / "a", directory_ / "none/b", &error_));
  expectError(NSCocoaErrorDomain, NSFileNoSuchFileError, "none/b");
}

TEST_F(FileManagerTest, ListsADirectoryInByteOrder) {
  for (const char* name : {"b", "\xff", "a\nb", "B", ".hidden"}) put(name);
  const auto names = files_.contentsOfDirectoryAtPath(directory_.path());
  ASSERT_TRUE(names);
  EXPECT_EQ(*names, (std::vector<std::string>{".hidden", "B", "a\nb", "b", "\xff"}));
  EXPECT_FALSE(files_.contentsOfDirectoryAtPath(directory_ / "b", &error_));
  expectError(NSPOSIXErrorDomain, ENOTDIR, "b");
}

TEST_F(FileManagerTest, SetsPermissionsAndDates) {
  put("a");
  EXPECT_TRUE(files_.setPermissions(directory_ / "a", 0640));
  struct stat status{};
  ASSERT_EQ(stat((directory_ / "a").c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777U, 0640U);
  for (const std::int64_t time : {1'772'366'400'250'000'000L, -250'000'000L}) {
    const auto date = NSDate::fromNanoseconds(time);
    EXPECT_TRUE(files_.setModificationDate(directory_ / "a", date));
    EXPECT_EQ(NSURL(directory_ / "a").resourceValues()->contentModificationDate, date);
  }
  EXPECT_FALSE(files_.setPermissions(directory_ / "missing", 0600, &error_));
  expectError(NSCocoaErrorDomain, NSFileNoSuchFileError, "missing");
}

TEST_F(FileManagerTest, KeepsExtendedAttributesAsBytes) {
  put("a");
  const std::string path = directory_ / "a";
  const std::string bytes("\0\xff\n long enough to need a second, larger buffer:", 48);
  const std::string large = bytes + std::string(1000, 'x');
  for (const auto& value : {bytes, large, std::string()}) {
    ASSERT_TRUE(files_.setExtendedAttribute(path, "user.test", value, &error_))
        << error_->description();
    EXPECT_EQ(files_.extendedAttribute(path, "user.test"), value);
  }
  EXPECT_TRUE(files_.removeExtendedAttribute(path, "user.test", &error_));
  EXPECT_TRUE(files_.removeExtendedAttribute(path, "user.test", &error_));
  EXPECT_EQ(files_.extendedAttribute(path, "user.test", &error_), std::nullopt);
  EXPECT_EQ(error_, nullptr) << "an attribute that is not there is no failure";
}

TEST_F(FileManagerTest, SaysWhoseAttributesCannotBeRead) {
  EXPECT_EQ(files_.extendedAttribute(directory_ / "missing", "user.test", &error_), std::nullopt);
  expectError(NSCocoaErrorDomain, NSFileNoSuchFileError, "missing");
  error_ = nullptr;
  EXPECT_FALSE(files_.setExtendedAttribute(directory_ / "missing", "user.test", "x", &error_));
  expectError(NSCocoaErrorDomain, NSFileNoSuchFileError, "missing");
}

}  // namespace
}  // namespace yomber
