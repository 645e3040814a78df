#include "platform/foundation/drive_paths.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <fstream>
#include <optional>

#include "platform/foundation/temporary_directory.h"

namespace yomber {
namespace {

/// Sets or takes away a variable for a scope.
class Variable {
 public:
  Variable(const char* name, const std::optional<std::string>& value) : name_(name) {
    if (const char* const old = std::getenv(name)) old_ = old;
    put(value);
  }
  ~Variable() { put(old_); }
  Variable(const Variable&) = delete;
  Variable& operator=(const Variable&) = delete;

 private:
  void put(const std::optional<std::string>& value) const {
    if (value) {
      setenv(name_, value->c_str(), 1);
    } else {
      unsetenv(name_);
    }
  }

  const char* const name_;
  std::optional<std::string> old_;
};

mode_t modeOf(const std::string& path) {
  struct stat status{};
  return stat(path.c_str(), &status) == 0 ? status.st_mode & 07777U : 0;
}

class DrivePathsTest : public testing::Test {
 protected:
  TemporaryDirectory directory_;
  Variable noSession_{"XDG_RUNTIME_DIR", std::nullopt};
};

TEST_F(DrivePathsTest, PutsEverythingBelowTheHome) {
  const auto paths = DrivePaths::forHome("/srv/drive");
  EXPECT_EQ(paths.home, "/srv/drive");
  EXPECT_EQ(paths.tree, "/srv/drive/tree");
  EXPECT_EQ(paths.privateDirectory, "/srv/drive/private");
  EXPECT_EQ(paths.database, "/srv/drive/zarn.db");
  EXPECT_EQ(paths.store, "/srv/drive/store");
  EXPECT_EQ(paths.log, "/srv/drive/log");
  EXPECT_EQ(paths.runtimeDirectory, "/srv/drive/run");
  EXPECT_EQ(paths.daemonSocket, "/srv/drive/run/zarn.sock");
  EXPECT_EQ(paths.controlSocket, "/srv/drive/run/control.sock");
}

TEST_F(DrivePathsTest, NamesTheSessionDirectoryByTheHomesHash) {
  const Variable session("XDG_RUNTIME_DIR", "/run/user/7");
  const auto paths = DrivePaths::forHome("/srv/drive");
  // The first 16 digits of `printf /srv/drive | sha256sum`.
  EXPECT_EQ(paths.homeHash, "58a03c9238f03305");
  EXPECT_EQ(paths.daemonSocket, "/run/user/7/yomber/58a03c9238f03305/zarn.sock");
}

TEST_F(DrivePathsTest, IgnoresASessionDirectoryThatIsNotAbsolute) {
  const Variable session("XDG_RUNTIME_DIR", "run");
  EXPECT_EQ(DrivePaths::forHome("/srv/drive").runtimeDirectory, "/srv/drive/run");
}

TEST_F(DrivePathsTest, ComputesTheSamePlacesForEverySpellingOfAHome) {
  const std::string home = directory_ / "home";
  ASSERT_EQ(mkdir(home.c_str(), 0700), 0);
  ASSERT_EQ(symlink(home.c_str(), (directory_ / "link").c_str()), 0);
  const auto expected = DrivePaths::forHome(home).homeHash;
  EXPECT_EQ(DrivePaths::forHome(home + "/").homeHash, expected);
  EXPECT_EQ(DrivePaths::forHome(directory_ / "./home/../home//").homeHash, expected);
  EXPECT_EQ(DrivePaths::forHome(directory_ / "link").home, home);
}

TEST_F(DrivePathsTest, ComputesTheSamePlacesBeforeAndAfterTheHomeIsMade) {
  const std::string home = directory_ / "a/b/";
  const auto before = DrivePaths::forHome(home);
  ASSERT_EQ(before.create(), nullptr);
  EXPECT_EQ(DrivePaths::forHome(home).homeHash, before.homeHash);
}

TEST_F(DrivePathsTest, TakesTheDefaultHomeFromTheEnvironment) {
  const Variable user("HOME", "/home/ada");
  const Variable data("XDG_DATA_HOME", std::nullopt);
  const Variable none("YOMBER_HOME", std::nullopt);
  EXPECT_EQ(DrivePaths::forDefaultHome().home, "/home/ada/.local/share/yomber");
  const Variable relative("XDG_DATA_HOME", "data");
  EXPECT_EQ(DrivePaths::forDefaultHome().home, "/home/ada/.local/share/yomber");
  const Variable moved("XDG_DATA_HOME", "/data");
  EXPECT_EQ(DrivePaths::forDefaultHome().home, "/data/yomber");
  const Variable chosen("YOMBER_HOME", "/chosen");
  EXPECT_EQ(DrivePaths::forDefaultHome().home, "/chosen");
}

TEST_F(DrivePathsTest, MakesPrivateDirectoriesAndAcceptsThemAgain) {
  const auto paths = DrivePaths::forHome(directory_ / "parent/home");
  EXPECT_NE(paths.check(), nullptr);
  for (int round = 0; round < 2; ++round) {
    const auto error = paths.create();
    ASSERT_EQ(error, nullptr) << error->description();
  }
  EXPECT_EQ(paths.check(), nullptr);
  for (const auto& made : {paths.home, paths.tree, paths.privateDirectory, paths.store, paths.log,
                           paths.runtimeDirectory}) {
    EXPECT_EQ(modeOf(made), 0700U) << made;
  }
}

TEST_F(DrivePathsTest, MakesTheSessionsDirectories) {
  const Variable session("XDG_RUNTIME_DIR", directory_.path());
  const auto paths = DrivePaths::forHome(directory_ / "home");
  ASSERT_EQ(paths.create(), nullptr);
  EXPECT_EQ(modeOf(directory_ / "yomber"), 0700U);
  EXPECT_EQ(modeOf(paths.runtimeDirectory), 0700U);
}

TEST_F(DrivePathsTest, SaysWhatToDoAboutAMissingSessionDirectory) {
  const Variable session("XDG_RUNTIME_DIR", directory_ / "gone");
  const auto error = DrivePaths::forHome(directory_ / "home").create();
  ASSERT_NE(error, nullptr);
  EXPECT_NE(error->localizedDescription().find("XDG_RUNTIME_DIR"), std::string::npos);
}

TEST_F(DrivePathsTest, RefusesDirectoriesThatOthersMayEnter) {
  const auto paths = DrivePaths::forHome(directory_ / "home");
  ASSERT_EQ(paths.create(), nullptr);
  ASSERT_EQ(chmod(paths.tree.c_str(), 0750), 0);
  const auto error = paths.create();
  ASSERT_NE(error, nullptr);
  EXPECT_NE(error->localizedDescription().find("chmod 700 " + paths.tree), std::string::npos);
  EXPECT_EQ(modeOf(paths.tree), 0750U) << "what the user chose must not be changed silently";
}

TEST_F(DrivePathsTest, RefusesSymbolicLinksAndFilesInPlaceOfItsDirectories) {
  const auto paths = DrivePaths::forHome(directory_ / "home");
  ASSERT_EQ(mkdir(paths.home.c_str(), 0700), 0);
  ASSERT_EQ(mkdir((directory_ / "elsewhere").c_str(), 0700), 0);
  ASSERT_EQ(symlink((directory_ / "elsewhere").c_str(), paths.tree.c_str()), 0);
  auto error = paths.create();
  ASSERT_NE(error, nullptr);
  EXPECT_NE(error->localizedDescription().find("symbolic link"), std::string::npos);
  ASSERT_EQ(unlink(paths.tree.c_str()), 0);
  std::ofstream(paths.tree) << "a file";
  error = paths.create();
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(NSPOSIXErrorDomain, ENOTDIR)) << error->description();
}

TEST_F(DrivePathsTest, RefusesDirectoriesOfAnotherUser) {
  if (geteuid() != 0) GTEST_SKIP() << "only root can give a directory away";
  const auto paths = DrivePaths::forHome(directory_ / "home");
  ASSERT_EQ(paths.create(), nullptr);
  ASSERT_EQ(chown(paths.store.c_str(), 12345, 12345), 0);
  const auto error = paths.create();
  ASSERT_NE(error, nullptr);
  EXPECT_NE(error->localizedDescription().find("another user"), std::string::npos);
}

TEST_F(DrivePathsTest, RefusesAHomeWhoseSocketsWouldHaveTooLongNames) {
  const auto paths = DrivePaths::forHome(directory_ / std::string(100, 'x'));
  const auto error = paths.create();
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(NSPOSIXErrorDomain, ENAMETOOLONG)) << error->description();
  EXPECT_FALSE(std::filesystem::exists(paths.home));
}

TEST_F(DrivePathsTest, AStoreThatWasJoinedIsTheDrivesFromThenOn) {
  const std::string store = directory_ / "shared/store";
  auto paths = DrivePaths::forHome(directory_ / "home");
  ASSERT_EQ(paths.create(), nullptr) << "an own store without anything in it may be left";
  ASSERT_EQ(paths.joinStore(store), nullptr);
  EXPECT_EQ(paths.store, store);
  EXPECT_EQ(modeOf(store), 0700U);
  EXPECT_EQ(DrivePaths::forHome(paths.home).store, store);
  EXPECT_EQ(DrivePaths::forHome(paths.home).create(), nullptr);
  EXPECT_EQ(DrivePaths::forHome(paths.home).joinStore(store + "/"), nullptr);
}

TEST_F(DrivePathsTest, ANewDriveCanJoinAStoreAtOnce) {
  auto paths = DrivePaths::forHome(directory_ / "new/home");
  ASSERT_EQ(paths.joinStore(directory_ / "store"), nullptr);
  EXPECT_EQ(paths.create(), nullptr);
  EXPECT_EQ(DrivePaths::forHome(paths.home).store, directory_ / "store");
}

TEST_F(DrivePathsTest, ADriveKeepsTheStoreThatItBeganWith) {
  auto own = DrivePaths::forHome(directory_ / "own");
  ASSERT_EQ(own.create(), nullptr);
  std::ofstream(own.store + "/records") << "of all documents";
  auto error = own.joinStore(directory_ / "store");
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(NSPOSIXErrorDomain, EEXIST)) << error->description();
  EXPECT_EQ(DrivePaths::forHome(own.home).store, own.home + "/store");
  EXPECT_TRUE(std::filesystem::exists(own.store + "/records"));

  auto joined = DrivePaths::forHome(directory_ / "joined");
  ASSERT_EQ(joined.joinStore(directory_ / "store"), nullptr);
  error = joined.joinStore(directory_ / "another");
  ASSERT_NE(error, nullptr);
  EXPECT_NE(error->localizedDescription().find(directory_ / "store"), std::string::npos);
}

TEST_F(DrivePathsTest, AJoinedStoreThatIsAwayIsNotMadeAnew) {
  auto paths = DrivePaths::forHome(directory_ / "home");
  ASSERT_EQ(paths.joinStore(directory_ / "disk/store"), nullptr);
  std::filesystem::remove_all(directory_ / "disk");
  const auto error = DrivePaths::forHome(paths.home).create();
  ASSERT_NE(error, nullptr);
  EXPECT_NE(error->localizedDescription().find("mount the disk"), std::string::npos);
  EXPECT_FALSE(std::filesystem::exists(directory_ / "disk"));
}

}  // namespace
}  // namespace yomber
