// Drives at the limits of the system: very many folders, no watches left, very many clients.

#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <iostream>
#include <sstream>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "platform/foundation/file_descriptor.h"
#include "platform/foundation/sanitized.h"
#include "tests/harness/watch_process.h"

namespace yomber::testing {
namespace {

namespace fs = std::filesystem;

/// For what takes some seconds on a machine that has nothing else to do.
constexpr std::chrono::minutes kLongPatience{3};

/// How many of something a test makes: fewer under sanitizers, which it says.
int scaled(int full, int sanitized) {
  if (!kIsSanitized) return full;
  std::cout << "sanitizers are slow: " << sanitized << " instead of " << full << std::endl;
  return sanitized;
}

class Limits : public ::testing::Test {
 protected:
  /// Makes folders "f0", "f1"… in the open folder.
  static void makeFolders(int folder, int count) {
    for (int number = 0; number < count; ++number) {
      ASSERT_EQ(mkdirat(folder, ("f" + std::to_string(number)).c_str(), S_IRWXU), 0);
    }
  }
  /// A folder with so many folders in it.
  void makeWide(const std::string& name, int count) const {
    drive_.makeFolder(name);
    const FileDescriptor folder(open((drive_.root() + "/" + name).c_str(), O_PATH | O_DIRECTORY));
    makeFolders(folder.get(), count);
  }
  /// A chain of folders called "deep", with so many others beside each link. Answers the path of
  /// the last link from the root.
  std::string makeDeep(int depth, int beside) const {
    std::string path;
    FileDescriptor folder(open(drive_.root().c_str(), O_PATH | O_DIRECTORY));
    for (int level = 0; level < depth; ++level) {
      EXPECT_EQ(mkdirat(folder.get(), "deep", S_IRWXU), 0);
      folder = FileDescriptor(openat(folder.get(), "deep", O_PATH | O_DIRECTORY));
      makeFolders(folder.get(), beside);
      path += path.empty() ? "deep" : "/deep";
    }
    return path;
  }

  /// What a command prints; as text, since reading so much JSON would take longer than the drive.
  [[nodiscard]] std::vector<std::string> lines(const std::vector<std::string>& command) const {
    const ProcessResult result = drive_.yomber(command, kLongPatience);
    EXPECT_EQ(result.exitCode, 0) << result.errors;
    std::vector<std::string> lines;
    std::istringstream output(result.output);
    for (std::string line; std::getline(output, line);) lines.push_back(std::move(line));
    return lines;
  }

  /// What zarn says of itself; nothing while it does not answer.
  [[nodiscard]] nlohmann::json zarn() const {
    const nlohmann::json status = drive_.status();
    return status.is_object() ? status.value("zarn", nlohmann::json::object())
                              : nlohmann::json::object();
  }

  TestDrive drive_;
};

TEST_F(Limits, AHundredThousandFoldersDeepAndWideAreListedAndWatchedToTheirEnds) {
  // Paths of 500 levels stay below the system's 4,096 bytes.
  const int depth = scaled(500, 250);
  const int beside = scaled(99, 9);
  const int wide = scaled(49'999, 2'499);
  const std::string deepest = makeDeep(depth, beside);
  makeWide("wide", wide);
  drive_.up();
  ASSERT_TRUE(eventually([&] { return zarn()["scanning"] == false; }, kLongPatience));
  EXPECT_EQ(lines({"ls"}), (std::vector<std::string>{"deep/", "wide/"}));
  EXPECT_EQ(lines({"ls", deepest}).size(), static_cast<std::size_t>(beside));
  const std::vector<std::string> names = lines({"ls", "wide"});
  ASSERT_EQ(names.size(), static_cast<std::size_t>(wide));
  EXPECT_EQ(names.back(), "f" + std::to_string(wide - 1) + "/") << "numbers by value";
  const std::vector<std::string> folders = lines({"folders"});
  EXPECT_EQ(std::ranges::count(folders, "deep/"), depth);
  EXPECT_EQ(std::ranges::count_if(folders, [](const auto& name) { return name.starts_with("f"); }),
            depth * beside + wide);

  WatchProcess deep(drive_, deepest);
  ASSERT_TRUE(deep.shows("f" + std::to_string(beside - 1)));
  drive_.write(deepest + "/far down");
  EXPECT_TRUE(deep.shows("far down"));
  const std::string identifier = drive_.json({"id", deepest + "/far down"}).at(0)["id"];
  EXPECT_EQ(drive_.json({"url", identifier}).at(0)["location"],
            drive_.root() + "/" + deepest + "/far down");
}

TEST_F(Limits, WithoutAnyWatchTheDriveSaysWhatToRaiseAndChangesStillArrive) {
  // A user namespace has a limit of its own, so that the machine's other programs keep theirs.
  const std::vector<std::string> withoutWatches{
      "/usr/bin/unshare",
      "--user",
      "--map-root-user",
      "/bin/sh",
      "-c",
      "echo 0 >/proc/sys/user/max_inotify_watches && exec \"$@\"",
      "sh"};
  std::vector<std::string> trial = withoutWatches;
  trial.emplace_back("/bin/true");
  const ProcessResult possible = runProcess(trial);
  if (possible.exitCode != 0) GTEST_SKIP() << "no user namespace to be had: " << possible.errors;

  drive_.makeFolder("one/two");
  drive_.write("one/two/before");
  drive_.up(withoutWatches);
  WatchProcess watch(drive_, "one/two");
  ASSERT_TRUE(watch.shows("before"));
  nlohmann::json told = zarn();
  EXPECT_EQ(told["live"], false);
  EXPECT_EQ(told["watched_folders"], 0);
  EXPECT_THAT(told["advice"].get<std::string>(),
              ::testing::HasSubstr("raise fs.inotify.max_user_watches to at least "));
  EXPECT_THAT(drive_.yomber({"status"}).output,
              ::testing::AllOf(::testing::HasSubstr("found by scanning"),
                               ::testing::HasSubstr("fs.inotify.max_user_watches")));
  drive_.write("one/two/after");
  fs::remove(drive_.root() + "/one/two/before");
  EXPECT_TRUE(watch.converges({"after"}));
  drive_.makeFolder("one/two/later");
  EXPECT_TRUE(watch.converges({"after", "later"}));
}

TEST_F(Limits, WithWatchesToSpareNoAdviceIsGiven) {
  drive_.makeFolder("one/two");
  drive_.up();
  EXPECT_TRUE(eventually([&] { return zarn()["watched_folders"] > 2; }));
  nlohmann::json told = zarn();
  EXPECT_EQ(told["live"], true);
  EXPECT_EQ(told["advice"], "");
}

TEST_F(Limits, TheDaemonKeepsNothingOfAHundredClientsThatWereKilled) {
  for (int number = 0; number < 500; ++number) drive_.write("file " + std::to_string(number));
  // What the sanitizer holds back to find uses after the end would count as growth.
  const char* const options = std::getenv("ASAN_OPTIONS");
  drive_.environment()["ASAN_OPTIONS"] =
      (options != nullptr ? options + std::string(":") : "") + "quarantine_size_mb=1";
  drive_.up();
  // Killed after its listing, or in the middle of it.
  const auto visitAndDie = [&](bool listsToTheEnd) {
    LineProcess visitor({programPath("daemon_visitor"), drive_.home()}, drive_.environment());
    ASSERT_TRUE(visitor.readUntil(
        [&](const std::string& line) { return line == (listsToTheEnd ? "500" : "watching"); }));
  };
  const auto settled = [&] {
    nlohmann::json told;
    EXPECT_TRUE(eventually([&] {
      told = zarn();
      return told["watchers"] == 0;
    })) << told;
    return told;
  };
  for (int round = 0; round < 20; ++round) visitAndDie(round % 2 == 0);
  nlohmann::json early = settled();
  for (int round = 0; round < 100; ++round) visitAndDie(round % 2 == 0);
  nlohmann::json late = settled();
  EXPECT_LE(late["open_descriptors"].get<int>(), early["open_descriptors"].get<int>() + 2);
  const long growth = (kIsSanitized ? 32 : 4) * 1'000'000L;
  EXPECT_LE(late["resident_bytes"].get<long>(), early["resident_bytes"].get<long>() + growth);
}

}  // namespace
}  // namespace yomber::testing
