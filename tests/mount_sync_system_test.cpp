// Who syncs through the mount has it on the disk.
#include <array>
#include <cstring>
#include <fstream>
#include <functional>
#include <string>

#include <fcntl.h>
#include <sys/mman.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "tests/harness/cached_pages.h"
#include "tests/harness/file_contents.h"
#include "tests/harness/mount_fixture.h"

namespace yomber::testing {
namespace {

constexpr std::size_t kSize = 64 << 10;

class MountSync : public MountFixture {
 protected:
  void SetUp() override {
    std::ofstream(at("probe")) << "x";
    if (!unwrittenPages(onDisk("probe"), 0, 1)) GTEST_SKIP() << "needs cachestat (Linux 6.5)";
  }
  [[nodiscard]] std::uint64_t unwritten(const std::string& name) const {
    return unwrittenPages(onDisk(name), 0, kSize).value_or(0);
  }
  /// Changes the file through the mount until the system has not written all of it by itself.
  void change(const std::string& name, const std::function<void(char byte)>& write) {
    char byte = 'a';
    ASSERT_TRUE(eventually([&] {
      write(++byte);
      return unwritten(name) > 0;
    })) << name;
  }
  static void writeAll(int file, char byte) {
    const std::string bytes(kSize, byte);
    ASSERT_EQ(pwrite(file, bytes.data(), bytes.size(), 0), static_cast<ssize_t>(kSize));
  }
};

TEST_F(MountSync, WhatWasWrittenIsOnTheDiskAfterASync) {
  const OpenedFile file(at("report"), O_RDWR | O_CREAT);
  for (const auto sync : std::array<int (*)(int), 2>{fsync, fdatasync}) {
    change("report", [&](char byte) { writeAll(file.get(), byte); });
    ASSERT_EQ(sync(file.get()), 0);
    EXPECT_EQ(unwritten("report"), 0U);
  }
}

TEST_F(MountSync, WhatWasWrittenThroughAnotherDescriptorCountsAsWell) {
  makeAway("report", someContent(kSize, 1));
  const OpenedFile reader(at("report"), O_RDONLY);  // of what is away
  const OpenedFile writer(at("report"), O_WRONLY);
  change("report", [&](char byte) { writeAll(writer.get(), byte); });
  ASSERT_EQ(fsync(reader.get()), 0);
  EXPECT_EQ(unwritten("report"), 0U);
}

TEST_F(MountSync, WhatWasWrittenThroughAMapIsOnTheDiskAfterASync) {
  const OpenedFile file(at("report"), O_RDWR | O_CREAT);
  writeAll(file.get(), 'a');
  void* const map = mmap(nullptr, kSize, PROT_READ | PROT_WRITE, MAP_SHARED, file.get(), 0);
  ASSERT_NE(map, MAP_FAILED);
  ASSERT_EQ(fsync(file.get()), 0);
  std::memset(map, 'z', kSize);
  EXPECT_EQ(msync(map, kSize, MS_SYNC), 0);
  EXPECT_EQ(unwritten("report"), 0U);
  EXPECT_EQ(contentOf(onDisk("report")), std::string(kSize, 'z'));
  munmap(map, kSize);
}

}  // namespace
}  // namespace yomber::testing
