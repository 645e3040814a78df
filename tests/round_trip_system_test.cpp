// Many files of all kinds go into a whole drive, up to the store, away, and come back as they were.
#include <algorithm>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <sstream>

#include <gtest/gtest.h>

#include "platform/foundation/sanitized.h"
#include "tests/harness/content_client.h"
#include "tests/harness/odd_files.h"
#include "tests/harness/test_drive.h"

namespace yomber::testing {
namespace {

namespace fs = std::filesystem;
using Local = ContentClient::Local;
using Upload = ContentClient::Upload;
using Looks = std::map<std::string, FileLook>;

constexpr std::chrono::minutes kLongPatience{15};
constexpr std::uint64_t kLargestFault = 8192;
constexpr std::uint64_t kMostOfDaemon = 60 << 20;     // bytes of memory
constexpr std::uint64_t kMostOfExtension = 30 << 20;  // the same

std::uint64_t numberFrom(const char* variable, std::uint64_t otherwise, std::uint64_t sanitized) {
  if (const char* text = std::getenv(variable)) return std::strtoull(text, nullptr, 10);
  if (!kIsSanitized) return otherwise;
  std::cout << "sanitizers are slow: " << sanitized << " instead of " << otherwise << std::endl;
  return sanitized;
}

/// The most memory that a process has ever had, in bytes.
std::uint64_t peakOf(pid_t pid) {
  std::ifstream status("/proc/" + std::to_string(pid) + "/status");
  for (std::string line; std::getline(status, line);) {
    if (line.starts_with("VmHWM:")) return std::stoull(line.substr(6)) * 1024;
  }
  return 0;
}

class RoundTrip : public ::testing::Test {
 protected:
  void SetUp() override {
    drive_.up();
    client_.emplace(drive_.home());
    source_ = fs::path(drive_.home()).parent_path() / "many";
    fs::create_directory(source_);
  }

  [[nodiscard]] std::string there() const { return drive_.root() + "/many"; }

  /// Says how long a step took, and how much memory was needed.
  template <typename Step>
  void timed(const char* name, const Step& step) {
    const auto start = std::chrono::steady_clock::now();
    step();
    const std::chrono::duration<double> seconds = std::chrono::steady_clock::now() - start;
    std::cout << name << ": " << seconds.count() << " s; so far at most "
              << (peakOf(drive_.pidOf(TestDrive::Process::Zarn)) >> 20U) << " MiB of zarn, "
              << (peakOf(drive_.pidOf(TestDrive::Process::Extension)) >> 20U)
              << " MiB of the extension" << std::endl;
  }

  void run(const std::vector<std::string>& arguments) {
    const ProcessResult result = drive_.yomber(arguments, kLongPatience);
    ASSERT_FALSE(result.timedOut);
    ASSERT_EQ(result.exitCode, 0) << result.errors.substr(0, 2000);
  }

  void waitUntilConfirmed(const Looks& looks) {
    for (const auto& [path, look] : looks) {
      ContentClient::State state;
      const bool isConfirmed = eventually(
          [&] {
            state = client_->state(there() + "/" + path);
            return state.upload == Upload::CONFIRMED;
          },
          kLongPatience);
      ASSERT_TRUE(isConfirmed) << path << (state.error ? state.error->description() : "")
                               << (state.lastFailure ? state.lastFailure->description() : "");
    }
  }

  /// Tags that are set in the drive, beside those that came with the files.
  void tagSome(const Looks& looks) {
    std::size_t number = 0;
    for (const auto& [path, look] : looks) {
      if (number++ % 20 != 0) continue;
      const NSErrorRef error = client_->setTagNames(there() + "/" + path, {"kept", "for ever"});
      ASSERT_EQ(error, nullptr) << path << error->description();
    }
  }

  /// Fails for each file that differs; says nothing of more than a few.
  template <typename Difference>
  static void compare(const Looks& before, const Looks& after, const Difference& difference) {
    constexpr int kShown = 20;
    int wrong = 0;
    EXPECT_EQ(after.size(), before.size());
    for (const auto& [path, look] : before) {
      const auto found = after.find(path);
      const std::string text = found == after.end() ? "gone" : difference(look, found->second);
      if (text.empty() || ++wrong > kShown) continue;
      ADD_FAILURE() << path << ": " << text;
    }
    EXPECT_EQ(wrong, 0) << "of " << before.size() << " files";
  }

  void expectAllAreAway(const Looks& looks) {
    for (const auto& [path, look] : looks) {
      const std::string location = there() + "/" + path;
      EXPECT_EQ(client_->state(location).local, Local::FAULT) << path;
      EXPECT_LE(bytesOnDisk(location), kLargestFault) << path;
      if (HasFailure()) return;
    }
  }

  void expectLittleMemory() {
    const std::uint64_t daemon = peakOf(drive_.pidOf(TestDrive::Process::Zarn));
    const std::uint64_t extension = peakOf(drive_.pidOf(TestDrive::Process::Extension));
    if (kIsSanitized) return;  // their shadow is larger than what it shadows
    EXPECT_LE(daemon, kMostOfDaemon);
    EXPECT_LE(extension, kMostOfExtension);
  }

  TestDrive drive_;
  std::optional<ContentClient> client_;
  std::string source_;
};

TEST_F(RoundTrip, EveryFileComesBackAsItWas) {
  const std::uint64_t count = numberFrom("YOMBER_ROUND_TRIP_FILES", 1000, 200);
  const std::uint64_t largest = numberFrom("YOMBER_ROUND_TRIP_LARGEST", 64 << 20, 4 << 20);
  timed("make", [&] { makeOddFiles(source_, count, largest); });
  const Looks originals = looksBelow(source_);
  ASSERT_EQ(originals.size(), count);

  timed("put", [&] { run({"put", source_}); });
  timed("compare the copies", [&] { compare(originals, looksBelow(there()), differenceOfCopy); });
  timed("upload", [&] { waitUntilConfirmed(originals); });
  tagSome(originals);
  waitUntilConfirmed(originals);
  const Looks before = looksBelow(there());

  timed("evict", [&] { run({"evict", "many"}); });
  expectAllAreAway(before);
  // All but the content is to be seen as ever.
  compare(before, looksBelow(there(), false), difference);

  timed("provide", [&] { run({"provide", "many"}); });
  const Looks after = looksBelow(there());
  compare(before, after, difference);
  for (const auto& [path, look] : after) {
    ASSERT_EQ(client_->state(there() + "/" + path).local, Local::HERE) << path;
  }
  expectLittleMemory();
}

}  // namespace
}  // namespace yomber::testing
