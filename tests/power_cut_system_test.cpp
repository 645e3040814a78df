// A drive under load on a disk whose power is cut, against a manifest kept outside of it.
//
//   YOMBER_CUTS   how often (3)
//   YOMBER_SEED   what is done, and what survives of what was not synced (5)
#include <cstdlib>
#include <fstream>
#include <iostream>
#include <random>

#include <fcntl.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "platform/foundation/file_descriptor.h"
#include "platform/foundation/sanitized.h"
#include "tests/harness/test_drive.h"
#include "tests/manifest/manifest_check.h"
#include "tests/power/power_disk.h"

namespace yomber::testing {
namespace {

constexpr std::uint64_t kDiskBytes = 4ULL << 30;  // sparse

constexpr std::uint64_t kShort = kIsSanitized ? 1 : 3;
constexpr const char* kWhyShort =
    kIsSanitized ? " (fewer under a sanitizer, where everything takes longer)" : "";

std::uint64_t numberFromEnvironment(const char* name, std::uint64_t otherwise) {
  const char* const text = std::getenv(name);
  return text != nullptr ? std::strtoull(text, nullptr, 10) : otherwise;
}

class PowerCut : public ::testing::Test {
 protected:
  static constexpr int kWorkers = 3;

  void SetUp() override {
    if (const auto reason = PowerDisk::reasonItCannotBe()) GTEST_SKIP() << *reason;
    disk_.emplace(kDiskBytes);
    drive_.emplace(disk_->mountPoint());
    boot();
  }
  /// Starts the drive as after a boot of the machine: with a boot identifier of its own.
  void boot() {
    const std::string file = disk_->outside() + "/boot";
    std::ofstream(file) << power_.boot << "\n";
    power_.isCut = false;
    drive_->up({"/usr/bin/unshare", "-m", "/bin/sh", "-c",
                "mount --bind '" + file + "' /proc/sys/kernel/random/boot_id && exec \"$@\"",
                "sh"});
  }
  void sync() const {
    const FileDescriptor folder(open(drive_->home().c_str(), O_RDONLY | O_CLOEXEC));
    ASSERT_EQ(syncfs(folder.get()), 0);
  }
  /// Everything stops, and what was not synced is gone, but for so much of it by chance.
  std::uint64_t cutPower(Load& load, std::uint64_t seed, unsigned percent) {
    power_.isCut = true;
    disk_->cut(seed, percent);
    // Without a disk the drive answers nothing: whoever waits for it would do so to the time limit.
    load.requestStop();
    drive_->crash();
    load.stop();
    disk_->unmount();
    const std::uint64_t lost = disk_->lostBlocks();
    disk_->comeBack();
    power_.boot = "boot-" + std::to_string(seed);
    return lost;
  }

  const std::uint64_t seed_ = numberFromEnvironment("YOMBER_SEED", 5);
  Power power_;
  std::optional<PowerDisk> disk_;
  std::optional<TestDrive> drive_;
};

TEST_F(PowerCut, WhatWasConfirmedOrSyncedSurvives) {
  const std::uint64_t wanted = numberFromEnvironment("YOMBER_CUTS", kShort);
  std::cout << "seed " << seed_ << ", " << wanted << " cuts" << kWhyShort << std::endl;
  std::mt19937_64 random(seed_);
  Load load({.home = drive_->home(),
             .root = drive_->root(),
             .outside = disk_->outside(),
             .seed = seed_,
             .mayLosePower = true,
             .power = &power_},
            kWorkers);
  ManifestCheck check(load);
  load.begin();
  sync();
  std::uint64_t lost = 0;
  std::uint64_t cuts = 0;
  for (; cuts < wanted && !HasFailure(); ++cuts) {
    load.start();
    ASSERT_TRUE(load.waitForSteps(20 + random() % 200));
    const unsigned percent = random() % 2 == 0 ? 0U : static_cast<unsigned>(random() % 100);
    lost += cutPower(load, random(), percent);
    check.nothingWrongSurvived(power_.boot);
    boot();
    ASSERT_TRUE(check.settles()) << "after cut " << cuts + 1;
    check.nothingSafeWasLost();
    ASSERT_TRUE(check.settles()) << "after cut " << cuts + 1;
    check.everythingIsThere();
    check.everythingIsSafe();
    EXPECT_TRUE(isSoundDatabase(drive_->home() + "/zarn.db"));
    EXPECT_TRUE(isSoundDatabase(drive_->home() + "/store/records.db"));
  }
  check.allGoAndComeBack();
  std::cout << cuts << " cuts that lost " << lost << " blocks; " << load.summary() << "\n";
}

}  // namespace
}  // namespace yomber::testing
