// A drive under load whose processes are killed at random, against a manifest kept outside of it.
//
//   YOMBER_KILLS   how many kills that find jobs pending (25)
//   YOMBER_SEED    what is done and who is killed (3)
#include <array>
#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <iostream>
#include <random>

#include <gtest/gtest.h>

#include "platform/foundation/sanitized.h"
#include "platform/foundation/stopped_process.h"
#include "tests/harness/test_drive.h"
#include "tests/manifest/manifest_check.h"

namespace yomber::testing {
namespace {

using Process = TestDrive::Process;

constexpr std::uint64_t kShort = kIsSanitized ? 5 : 25;
constexpr const char* kWhyShort =
    kIsSanitized ? " (fewer under a sanitizer, where everything takes longer)" : "";

std::uint64_t numberFromEnvironment(const char* name, std::uint64_t otherwise) {
  const char* const text = std::getenv(name);
  return text != nullptr ? std::strtoull(text, nullptr, 10) : otherwise;
}

class KillManifest : public ::testing::Test {
 protected:
  static constexpr int kWorkers = 3;

  void SetUp() override {
    outside_ = std::filesystem::path(drive_.home()).parent_path() / "outside";
    std::filesystem::create_directory(outside_);
    drive_.up();
  }
  [[nodiscard]] LoadOptions options() const {
    return {.home = drive_.home(),
            .root = drive_.root(),
            .outside = outside_,
            .seed = seed_,
            .power = &power_};
  }

  /// False when no job was pending at that moment: then nobody is killed.
  bool killWhileJobsPend(Process victim) {
    const pid_t process = drive_.pidOf(victim);
    // Looked at while it stands still, so that the jobs are those that the kill finds.
    const StoppedProcess zarn(drive_.pidOf(Process::Zarn));
    const bool isPending = jobsInDatabase(drive_.home()).value_or(0) > 0;
    if (isPending) ::kill(process, SIGKILL);
    return isPending;
  }

  const std::uint64_t seed_ = numberFromEnvironment("YOMBER_SEED", 3);
  std::string outside_;
  Power power_;
  TestDrive drive_;
};

TEST_F(KillManifest, NothingIsLostOrDoubledOrWrongWhoeverIsKilled) {
  const std::uint64_t wanted = numberFromEnvironment("YOMBER_KILLS", kShort);
  std::cout << "seed " << seed_ << ", " << wanted << " kills" << kWhyShort << std::endl;
  constexpr std::array kVictims{Process::Zarn, Process::Zarn, Process::Host, Process::Extension};
  std::mt19937_64 random(seed_);
  Load load(options(), kWorkers);
  ManifestCheck check(load);
  load.begin();
  std::uint64_t kills = 0;
  std::uint64_t idle = 0;
  for (; kills < wanted && !HasFailure(); load.stop()) {
    load.start();
    ASSERT_TRUE(load.waitForSteps(10 + random() % 60));
    const bool isKill = killWhileJobsPend(kVictims.at(random() % kVictims.size()));
    ++(isKill ? kills : idle);
    ASSERT_TRUE(load.waitForSteps(random() % 30));
    load.stop();
    check.nothingWrongCanBeRead();
    ASSERT_TRUE(check.settles()) << "after kill " << kills;
    check.everythingIsThere();
    check.someCanBeProvided(1);
    if (HasFailure()) std::cout << "after kill " << kills << "\n";
  }
  check.allGoAndComeBack();
  std::cout << kills << " kills with jobs pending, " << idle << " without; " << load.summary()
            << "\n";
}

}  // namespace
}  // namespace yomber::testing
