// What an application is told when content cannot be had, and when it asks for what the mount does
// not have.
#include <cerrno>
#include <filesystem>
#include <fstream>
#include <string>

#include <fcntl.h>
#include <sys/resource.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "tests/harness/file_contents.h"
#include "tests/harness/mount_fixture.h"

namespace yomber::testing {
namespace {

namespace fs = std::filesystem;

constexpr std::size_t kSize = 50'000;

class MountFailures : public MountFixture {
 protected:
  using MountFixture::MountFixture;

  /// Of a read of what only the store has; 0 when it succeeds.
  [[nodiscard]] int failureToRead(const std::string& name) const {
    const OpenedFile file(at(name), O_RDONLY);
    char byte = 0;
    return pread(file.get(), &byte, 1, kSize - 1) == 1 ? 0 : errno;
  }
  /// All the bytes that the store has.
  [[nodiscard]] std::string assets() { return mounted_.drive().home() + "/store/assets"; }

  const std::string content_ = someContent(kSize, 3);
};

TEST_F(MountFailures, WhoIsSignedOutMayNotRead) {
  makeAway("away", content_);
  ASSERT_EQ(mounted_.drive().yomber({"account", "sign-out"}).exitCode, 0);
  EXPECT_TRUE(eventually([&] { return failureToRead("away") == EACCES; }));
  EXPECT_TRUE(isAway("away"));
  mounted_.drive().signIn();
  EXPECT_TRUE(eventually([&] { return contentOf(at("away")) == content_; }));
}

TEST_F(MountFailures, ContentThatTheStoreHasLostIsAnErrorAndNoOtherBytes) {
  makeAway("away", content_);
  fs::rename(assets(), assets() + " elsewhere");
  fs::create_directory(assets());
  EXPECT_EQ(failureToRead("away"), EIO);
  EXPECT_TRUE(isAway("away"));
  fs::remove_all(assets());
  fs::rename(assets() + " elsewhere", assets());
  EXPECT_TRUE(eventually([&] { return contentOf(at("away")) == content_; }));
}

TEST_F(MountFailures, WhatCannotBeSyncedIsNotSaidToBe) {
  makeAway("away", content_);
  const OpenedFile file(at("away"), O_RDONLY);
  EXPECT_EQ(fsync(file.get()), 0);
  rlimit before{};
  ASSERT_EQ(prlimit(mounted_.pid(), RLIMIT_NOFILE, nullptr, &before), 0);
  const rlimit none{.rlim_cur = 3, .rlim_max = before.rlim_max};
  ASSERT_EQ(prlimit(mounted_.pid(), RLIMIT_NOFILE, &none, nullptr), 0);
  EXPECT_EQ(fsync(file.get()), -1);
  EXPECT_EQ(errno, EMFILE);
  ASSERT_EQ(prlimit(mounted_.pid(), RLIMIT_NOFILE, &before, nullptr), 0);
  EXPECT_EQ(fsync(file.get()), 0);
}

class WhereMarksStay : public MountFailures {
 protected:
  WhereMarksStay() : MountFailures({}, {"mount.mark.taken"}) {}
};

TEST_F(WhereMarksStay, WhatIsAwayIsNotSaidToBeEmptied) {
  makeAway("away", content_);
  EXPECT_EQ(truncate(at("away").c_str(), 0), -1);
  EXPECT_EQ(errno, EIO);
}

class WithoutRoom : public MountFailures {
 protected:
  WithoutRoom() : MountFailures({}, {"zarn.fill.begun"}) {}
};

TEST_F(WithoutRoom, OnThisDiskAReadSaysSo) {
  makeAway("away", content_);
  EXPECT_EQ(failureToRead("away"), ENOSPC);
  EXPECT_TRUE(isAway("away"));
}

TEST_F(MountFailures, AFileWithoutANameIsClearlyRefused) {
  EXPECT_EQ(open(mounted_.folder().c_str(), O_TMPFILE | O_RDWR | O_CLOEXEC, 0600), -1);
  EXPECT_EQ(errno, EOPNOTSUPP);
}

TEST_F(MountFailures, AFolderAndTheWholeDriveAreSynced) {
  fs::create_directory(at("folder"));
  std::ofstream(at("folder/report")) << "content";
  const OpenedFile folder(at("folder"), O_RDONLY | O_DIRECTORY);
  EXPECT_EQ(fsync(folder.get()), 0);
  EXPECT_EQ(fdatasync(folder.get()), 0);
  EXPECT_EQ(syncfs(folder.get()), 0);
}

}  // namespace
}  // namespace yomber::testing
