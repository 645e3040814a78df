// What a drive's processes log, as `yomber log` shows it, and the scripts that complete commands.
#include <algorithm>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>
#include <utility>
#include <vector>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "platform/foundation/log_sinks.h"
#include "platform/foundation/temporary_directory.h"
#include "tests/harness/test_drive.h"

namespace yomber::testing {
namespace {

namespace fs = std::filesystem;
using ::testing::HasSubstr;
using ::testing::Not;

std::vector<std::string> linesOf(const std::string& text) {
  std::vector<std::string> lines;
  std::istringstream stream(text);
  for (std::string line; std::getline(stream, line);) lines.push_back(line);
  return lines;
}

class LogCommand : public ::testing::Test {
 protected:
  void SetUp() override {
    unsetenv("XDG_RUNTIME_DIR");
    if (logsToJournal()) GTEST_SKIP() << "this machine logs to its journal";
  }
  std::string shown(const std::vector<std::string>& options = {}) const {
    std::vector<std::string> words{"log", "--lines", "100000"};
    words.insert(words.end(), options.begin(), options.end());
    const auto result = drive_.yomber(words);
    EXPECT_EQ(result.exitCode, 0) << result.errors;
    return result.output;
  }
  [[nodiscard]] std::size_t debugLines() const {
    const auto lines = linesOf(shown());
    return static_cast<std::size_t>(std::ranges::count_if(
        lines, [](const std::string& line) { return line.find("[DEBUG]") != std::string::npos; }));
  }

  TestDrive drive_;
};

TEST_F(LogCommand, ShowsWhatEveryProcessLoggedInTheOrderOfTime) {
  drive_.up();
  ASSERT_EQ(drive_.yomber({"log", "--level", "debug"}).exitCode, 0);
  ASSERT_EQ(drive_.yomber({"ls"}).exitCode, 0);
  const auto isOf = [&](const std::string& program) {
    return [&, program] { return shown().find(" " + program + "[") != std::string::npos; };
  };
  for (const char* const program : {"zarn", "fileproviderd", "qs-fileprovider", "supervisor"})
    EXPECT_TRUE(eventually(isOf(program))) << program;
  auto lines = linesOf(shown());
  EXPECT_TRUE(std::ranges::is_sorted(lines));
  const auto last = drive_.yomber({"log", "--lines", "3"});
  EXPECT_EQ(linesOf(last.output).size(), 3U);
}

TEST_F(LogCommand, TellsRunningProcessesHowMuchToLog) {
  drive_.up();
  ASSERT_EQ(drive_.yomber({"ls"}).exitCode, 0);
  ASSERT_EQ(debugLines(), 0U);
  ASSERT_EQ(drive_.yomber({"log", "--level", "debug"}).exitCode, 0);
  const auto hasListed = [&] {
    EXPECT_EQ(drive_.yomber({"ls"}).exitCode, 0);
    return debugLines() > 0;
  };
  EXPECT_TRUE(eventually(hasListed));
  EXPECT_THAT(shown(), HasSubstr("┏"));
  ASSERT_EQ(drive_.yomber({"log", "--level", "default"}).exitCode, 0);
  // What was under way is still written; a listing that begins now is not.
  std::size_t before = 0;
  const auto isQuiet = [&] {
    EXPECT_EQ(drive_.yomber({"ls"}).exitCode, 0);
    const std::size_t now = debugLines();
    return std::exchange(before, now) == now;
  };
  EXPECT_TRUE(eventually(isQuiet));
  EXPECT_EQ(drive_.yomber({"log", "--level", "loud"}).exitCode, 64);
}

TEST_F(LogCommand, FollowsAFileThatGoesOnUnderAnotherNameWithoutRepeatingIt) {
  drive_.up();  // makes the folder
  drive_.down();
  const std::string folder = drive_.home() + "/log/";
  const auto lineOf = [](int number) {
    return "9999-01-01 00:00:0" + std::to_string(number) + " guest " + std::to_string(number);
  };
  std::ofstream(folder + "guest.log") << lineOf(1) << "\n";
  LineProcess following(drive_.commandLine({"log", "--follow"}), drive_.environment());
  const auto isLine = [&](int number) {
    return [line = lineOf(number)](const std::string& each) { return each == line; };
  };
  ASSERT_TRUE(following.readUntil(isLine(1)));
  std::ofstream(folder + "guest.log", std::ios::app) << lineOf(2) << "\n";
  ASSERT_TRUE(following.readUntil(isLine(2)));
  fs::rename(folder + "guest.log", folder + "guest.1.log");
  std::ofstream(folder + "guest.log") << lineOf(3) << "\n";
  std::vector<std::string> read;
  ASSERT_TRUE(following.readUntil([&](const std::string& line) {
    read.push_back(line);
    return line == lineOf(3);
  }));
  EXPECT_EQ(read, std::vector<std::string>{lineOf(3)});
}

TEST(CompletionCommand, CompletesCommandsInBash) {
  TestDrive drive;
  const TemporaryDirectory folder;
  const std::string script = folder / "completion";
  const auto printed = drive.yomber({"completion", "bash"});
  ASSERT_EQ(printed.exitCode, 0);
  std::ofstream(script) << printed.output;
  const auto completed = runProcess(
      {"/bin/bash", "-c",
       "source '" + script +
           "'; COMP_WORDS=(yomber ac); COMP_CWORD=1; _yomber; echo \"${COMPREPLY[@]}\"; "
           "COMP_WORDS=(yomber account sign-i); COMP_CWORD=2; _yomber; echo \"${COMPREPLY[@]}\""});
  EXPECT_EQ(completed.exitCode, 0) << completed.errors;
  EXPECT_EQ(completed.output, "account\nsign-in\n");
}

TEST(CompletionCommand, QuotesDescriptionsForFish) {
  TestDrive drive;
  const auto printed = drive.yomber({"completion", "fish"});
  ASSERT_EQ(printed.exitCode, 0);
  EXPECT_THAT(printed.output, HasSubstr("drive\\'s"));
  for (const std::string& line : linesOf(printed.output)) {
    std::size_t quotes = 0;
    for (std::size_t i = 0; i < line.size(); ++i) {
      if (line[i] == '\\') {
        ++i;
      } else if (line[i] == '\'') {
        ++quotes;
      }
    }
    EXPECT_EQ(quotes % 2, 0U) << line;
  }
}

}  // namespace
}  // namespace yomber::testing
