// What the mount is told of changes while applications use what has changed.
#include <array>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <set>
#include <string>
#include <vector>

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <sys/uio.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "tests/harness/aside.h"
#include "tests/harness/cached_pages.h"
#include "tests/harness/file_contents.h"
#include "tests/harness/mount_fixture.h"

namespace yomber::testing {
namespace {

namespace fs = std::filesystem;

struct stat statusOf(const std::string& path) {
  struct stat status{};
  EXPECT_EQ(stat(path.c_str(), &status), 0) << path;
  return status;
}

/// Gives a file or folder the dates that it had.
void putDatesBack(const std::string& path, const struct stat& before) {
  const std::array<timespec, 2> times{before.st_atim, before.st_mtim};
  ASSERT_EQ(utimensat(AT_FDCWD, path.c_str(), times.data(), 0), 0);
}

class MountNotices : public MountFixture {
 protected:
  explicit MountNotices(std::vector<std::string> gates = {},
                        const std::vector<std::string>& failing = {})
      : MountFixture(std::move(gates), failing) {}

  /// What happened on the disk before has been told, and the kernel knows of it.
  void waitForNotices() {
    // What is told at once is in no order.
    for (int i = 0; i < 2; ++i) {
      std::ofstream(onDisk("witness"), std::ios::app) << "x";
      const auto size = fs::file_size(onDisk("witness"));
      EXPECT_TRUE(eventually([&] { return fs::file_size(at("witness")) == size; }));
    }
  }
  void makeWitness() {
    std::ofstream(at("witness")) << "x";
    ASSERT_TRUE(isConfirmed("witness"));
    EXPECT_EQ(fs::file_size(at("witness")), 1U);
  }
};

TEST_F(MountNotices, AFolderWhoseDateWasPutBackIsListedAnew) {
  fs::create_directory(at("d"));
  std::ofstream(at("d/old")) << "x";
  ASSERT_TRUE(isConfirmed("d/old"));
  const auto names = [&] {
    std::set<std::string> result;
    for (const auto& entry : fs::directory_iterator(at("d"))) {
      result.insert(entry.path().filename());
    }
    return result;
  };
  EXPECT_EQ(names(), std::set<std::string>{"old"});
  EXPECT_EQ(names(), std::set<std::string>{"old"});
  const struct stat before = statusOf(onDisk("d"));
  std::ofstream(onDisk("d/new")) << "x";
  putDatesBack(onDisk("d"), before);
  EXPECT_TRUE(eventually([&] { return names() == std::set<std::string>{"new", "old"}; }));
}

TEST_F(MountNotices, WhatChangesInAFolderThatTheDriveLeavesAloneShows) {
  fs::create_directory(at("x.part"));
  std::ofstream(at("x.part/f")) << "x";
  EXPECT_EQ(fs::file_size(at("x.part/f")), 1U);
  std::ofstream(onDisk("x.part/f")) << "longer";
  EXPECT_TRUE(eventually([&] { return fs::file_size(at("x.part/f")) == 6U; }));
  EXPECT_EQ(contentOf(at("x.part/f")), "longer");
}

TEST_F(MountNotices, WhatChangesBelowAFolderThatTheDriveLeavesAloneFromNowOnShows) {
  fs::create_directories(at("d/sub"));
  std::ofstream(at("d/sub/f")) << "x";
  ASSERT_TRUE(isConfirmed("d/sub/f"));
  EXPECT_EQ(fs::file_size(at("d/sub/f")), 1U);
  ASSERT_EQ(rename(at("d").c_str(), at("d.part").c_str()), 0);
  EXPECT_EQ(fs::file_size(at("d.part/sub/f")), 1U);
  EXPECT_TRUE(eventually([&] { return mounted_.drive().names().empty(); }));
  std::ofstream(onDisk("d.part/sub/f")) << "longer";
  std::ofstream(onDisk("d.part/sub/g")) << "new";
  EXPECT_TRUE(eventually([&] { return fs::file_size(at("d.part/sub/f")) == 6U; }));
  EXPECT_EQ(contentOf(at("d.part/sub/f")), "longer");
  fs::remove(onDisk("d.part/sub/g"));
  EXPECT_TRUE(eventually([&] { return !fs::exists(at("d.part/sub/g")); }));
}

/// What applications have open while the drive calls it, or a folder above it, something else.
class RenamedElsewhere : public MountNotices {
 protected:
  void SetUp() override {
    makeWitness();
    fs::create_directories(at("d/sub"));
    std::ofstream(at("d/sub/f")) << "content";
    ASSERT_TRUE(isConfirmed("d/sub/f"));
  }
  /// Nobody looks up the new name here.
  void renameElsewhere(const std::string& path, const std::string& name) {
    ASSERT_EQ(mounted_.drive().yomber({"rename", path, name}).exitCode, 0);
    waitForNotices();
  }
};

TEST_F(RenamedElsewhere, AFolderIsWorkedInAsBefore) {
  const OpenedFile folder(at("d"), O_RDONLY | O_DIRECTORY);
  const OpenedFile below(at("d/sub"), O_PATH | O_DIRECTORY);
  renameElsewhere("d", "e");
  EXPECT_EQ(mkdirat(folder.get(), "new", 0700), 0) << strerror(errno);
  struct stat status{};
  EXPECT_EQ(fstatat(folder.get(), "sub/f", &status, 0), 0) << strerror(errno);
  EXPECT_EQ(mkdirat(below.get(), "inner", 0700), 0) << strerror(errno);
  EXPECT_TRUE(fs::is_directory(onDisk("e/sub/inner")));
  EXPECT_TRUE(fs::exists(onDisk("e/new")));
}

TEST_F(RenamedElsewhere, AFileThatIsAwayIsReadAsBefore) {
  const std::string content = someContent(200'000, 5);
  std::ofstream(at("d/away")) << content;
  ASSERT_TRUE(isConfirmed("d/away"));
  evict("d/away");
  const OpenedFile file(at("d/away"), O_RDONLY);
  renameElsewhere("d/away", "other");
  renameElsewhere("d", "e");
  EXPECT_TRUE(file.read(content.size(), 0) == content);
}

constexpr const char* kCopying = "zarn.fill.copying";

class WhileAMoveWaitsForContent : public MountNotices {
 protected:
  WhileAMoveWaitsForContent() : MountNotices({kCopying}) {}
};

TEST_F(WhileAMoveWaitsForContent, ChangesShowElsewhereAtOnceAndInItsFolderAfterwards) {
  makeWitness();
  fs::create_directory(at("d"));
  makeAway("d/report", someContent(50'000, 4));
  EXPECT_FALSE(fs::exists(at("d/new")));
  Aside moving([&] { return rename(at("d/report").c_str(), at("d/report.part").c_str()); });
  ASSERT_TRUE(eventually([&] { return mounted_.isReached(kCopying); }));
  std::ofstream(onDisk("d/new")) << "x";
  EXPECT_TRUE(isConfirmed("d/new"));
  waitForNotices();
  EXPECT_FALSE(moving.isDone());
  mounted_.openGate(kCopying);
  EXPECT_EQ(moving.result(), 0);
  EXPECT_TRUE(eventually([&] { return fs::exists(at("d/new")); }));
}

TEST_F(MountNotices, ContentWhoseDateWasPutBackIsReadAnew) {
  mounted_.unmount();
  const LineProcess mount({programPath("yomber-mount"), "--home", mounted_.drive().home(),
                           "--no-pass-through", mounted_.folder()},
                          mounted_.drive().environment());
  std::ofstream(onDisk("report")) << "before";
  ASSERT_TRUE(isConfirmed("report"));
  ASSERT_TRUE(eventually([&] { return contentOf(at("report")) == "before"; }));
  const OpenedFile reader(at("report"), O_RDONLY);
  EXPECT_EQ(reader.read(6, 0), "before");
  const struct stat before = statusOf(onDisk("report"));
  {
    const OpenedFile writer(onDisk("report"), O_WRONLY);
    ASSERT_EQ(pwrite(writer.get(), "AFTER!", 6, 0), 6);
  }
  putDatesBack(onDisk("report"), before);
  EXPECT_TRUE(eventually([&] { return reader.read(6, 0) == "AFTER!"; }));
  EXPECT_EQ(contentOf(at("report")), "AFTER!");
}

constexpr const char* kLooked = "mount.change.looked";

class WhileANoticeIsApplied : public MountNotices {
 protected:
  WhileANoticeIsApplied() : MountNotices({kLooked}) {}
};

TEST_F(WhileANoticeIsApplied, WhatIsMovedThereKeepsItsPlace) {
  std::ofstream(at("report")) << "old";
  EXPECT_TRUE(eventually([&] { return mounted_.isReached(kLooked); }));
  std::ofstream(at("draft")) << "new";
  const OpenedFile place(at("draft"), O_PATH);
  Aside moving([&] { return rename(at("draft").c_str(), at("report").c_str()); });
  EXPECT_TRUE(eventually([&] { return moving.isAsked(); }));
  // The rename has gone as far as it can when the mount has answered others.
  struct statvfs space{};
  for (int i = 0; i < 1000; ++i) EXPECT_EQ(statvfs(mounted_.folder().c_str(), &space), 0);
  mounted_.openGate(kLooked);
  EXPECT_EQ(moving.result(), 0);
  makeWitness();
  waitForNotices();
  // Nobody has looked it up since.
  const std::string self = "/proc/self/fd/" + std::to_string(place.get());
  EXPECT_EQ(chmod(self.c_str(), 0600), 0);
  EXPECT_EQ(statusOf(onDisk("report")).st_mode & ALLPERMS, 0600U);
}

/// Whatever the mount is told it does not take.
class WhileNoNoticeIsTaken : public MountNotices {
 protected:
  WhileNoNoticeIsTaken() : MountNotices({}, {"mount.change.told"}) {}
};

TEST_F(WhileNoNoticeIsTaken, ItStartsAfreshAndSeesWhatHasChanged) {
  for (const char* content : {"a", "bc", "def", "ghij"}) {
    std::ofstream(onDisk("report")) << content;
    EXPECT_TRUE(eventually([&] { return contentOf(at("report")) == content; })) << content;
    EXPECT_TRUE(
        eventually([&] { return fs::file_size(at("report")) == std::string(content).size(); }));
  }
  fs::remove(onDisk("report"));
  EXPECT_TRUE(eventually([&] { return !fs::exists(at("report")); }));
}

TEST_F(MountNotices, AWriteThatIsToBeOnTheDiskIsThereWhenItReturns) {
  constexpr off_t kOffset = 40'960;
  makeAway("report", someContent(100'000, 1));
  const OpenedFile file(at("report"), O_WRONLY);
  for (const int flag : {RWF_DSYNC, RWF_SYNC}) {
    std::string bytes(8192, flag == RWF_SYNC ? 's' : 'd');
    iovec part{.iov_base = bytes.data(), .iov_len = bytes.size()};
    ASSERT_EQ(pwritev2(file.get(), &part, 1, kOffset, 0), 8192);
    if (!unwrittenPages(onDisk("report"), kOffset, bytes.size())) {
      GTEST_SKIP() << "needs cachestat";
    }
    ASSERT_EQ(pwritev2(file.get(), &part, 1, kOffset, flag), 8192);
    EXPECT_EQ(unwrittenPages(onDisk("report"), kOffset, bytes.size()), 0U);
  }
}

}  // namespace
}  // namespace yomber::testing
