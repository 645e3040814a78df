// What the mount is told of changes while applications use what has changed.
#include <filesystem>
#include <fstream>
#include <optional>
#include <string>
#include <vector>

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <sys/syscall.h>
#include <sys/uio.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "tests/harness/aside.h"
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

class MountNotices : public MountFixture {
 protected:
  explicit MountNotices(std::vector<std::string> gates = {}) : MountFixture(std::move(gates)) {}

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

/// Pages of a part of a file that are not on the disk yet; nothing where the system does not tell.
std::optional<std::uint64_t> unwrittenPages(const std::string& path, off_t offset,
                                            std::size_t length) {
  constexpr long kCachestat = 451;
  struct {
    std::uint64_t offset, length;
  } range{static_cast<std::uint64_t>(offset), length};
  struct {
    std::uint64_t cached = 0, dirty = 0, inWriteback = 0, evicted = 0, recentlyEvicted = 0;
  } pages;
  const OpenedFile file(path, O_RDONLY);
  if (syscall(kCachestat, file.get(), &range, &pages, 0) != 0) return std::nullopt;
  return pages.dirty + pages.inWriteback;
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
