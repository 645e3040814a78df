// What forgets has to forget: the layer under the tests of power cuts.
#include "tests/power/power_disk.h"

#include <array>
#include <filesystem>
#include <fstream>

#include <fcntl.h>
#include <unistd.h>

#include <gtest/gtest.h>

namespace yomber::testing {
namespace {

constexpr std::uint64_t kBytes = 32 << 20;
constexpr std::size_t kBlock = 4096;

class PowerDiskTest : public ::testing::Test {
 protected:
  void SetUp() override {
    if (const auto reason = PowerDisk::reasonItCannotBe()) GTEST_SKIP() << *reason;
    disk_.emplace(kBytes);
  }
  [[nodiscard]] std::string at(const std::string& name) const {
    return disk_->mountPoint() + "/" + name;
  }
  void write(const std::string& name, const std::string& content, bool isSynced) const {
    const int file = open(at(name).c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600);
    ASSERT_EQ(::write(file, content.data(), content.size()), static_cast<ssize_t>(content.size()));
    if (isSynced) {
      ASSERT_EQ(fsync(file), 0);
    }
    close(file);
  }
  void loseAndComeBack() {
    disk_->cut(1, 0);
    disk_->unmount();
    disk_->comeBack();
  }

  std::optional<PowerDisk> disk_;
};

TEST_F(PowerDiskTest, WhatWasSyncedStaysAndWhatWasNotIsGone) {
  write("synced", "stays", true);
  write("unsynced", "goes", false);
  loseAndComeBack();
  std::string content;
  std::ifstream(at("synced")) >> content;
  EXPECT_EQ(content, "stays");
  EXPECT_FALSE(std::filesystem::exists(at("unsynced")));
}

TEST_F(PowerDiskTest, NothingCanBeWrittenAfterThePowerWent) {
  disk_->cut(1, 0);
  const int file = open(at("late").c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600);
  const bool isSynced = file >= 0 && ::write(file, "late", 4) == 4 && fsync(file) == 0;
  if (file >= 0) close(file);
  EXPECT_FALSE(isSynced);
  disk_->unmount();
  disk_->comeBack();
  EXPECT_FALSE(std::filesystem::exists(at("late")));
  write("afterwards", "again", true);
}

/// Below the file system, where its own cache does not matter.
TEST_F(PowerDiskTest, OnlyTheBlocksThatWereNotSyncedAreLost) {
  disk_->cut(1, 0);
  disk_->unmount();
  disk_->comeBack();
  const int bare = open(disk_->diskPath().c_str(), O_RDWR | O_CLOEXEC);
  ASSERT_GE(bare, 0);
  constexpr std::uint64_t kFirst = kBytes / kBlock * 7 / 8;  // the journal is in the middle
  constexpr std::uint64_t kCount = 200;
  const std::string synced(kBlock, 's');
  const std::string unsynced(kBlock, 'u');
  const auto fill = [&](const std::string& block) {
    for (std::uint64_t i = 0; i < kCount; ++i) {
      ASSERT_EQ(pwrite(bare, block.data(), kBlock, static_cast<off_t>((kFirst + i) * kBlock)),
                static_cast<ssize_t>(kBlock));
    }
  };
  fill(synced);
  ASSERT_EQ(fdatasync(bare), 0);
  fill(unsynced);
  close(bare);
  disk_->cut(7, 50);
  const std::uint64_t lost = disk_->lostBlocks();
  EXPECT_GT(lost, kCount / 4);
  EXPECT_LT(lost, kCount * 3 / 4);
  disk_->unmount();
  disk_->comeBack();
  std::ifstream file(disk_->diskPath(), std::ios::binary);
  file.seekg(static_cast<std::streamoff>(kFirst * kBlock));
  std::uint64_t older = 0;
  for (std::uint64_t i = 0; i < kCount; ++i) {
    std::string block(kBlock, '\0');
    file.read(block.data(), kBlock);
    older += block == synced ? 1U : 0U;
    EXPECT_TRUE(block == synced || block == unsynced);
  }
  EXPECT_EQ(older, lost);
}

}  // namespace
}  // namespace yomber::testing
