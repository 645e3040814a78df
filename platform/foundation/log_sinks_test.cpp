#include "platform/foundation/log_sinks.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <fstream>
#include <regex>
#include <vector>

#include "platform/foundation/log_level.h"
#include "platform/foundation/temporary_directory.h"

namespace yomber {
namespace {

std::vector<std::string> linesOf(const std::string& path) {
  std::vector<std::string> lines;
  std::ifstream file(path);
  for (std::string line; std::getline(file, line);) lines.push_back(line);
  return lines;
}

class FileSinkTest : public testing::Test {
 protected:
  LogTargets targets() const { return {.program = "zarn", .directory = directory_.path()}; }

  TemporaryDirectory directory_;
  const std::string file_ = directory_ / "zarn.log";
};

TEST_F(FileSinkTest, ShowsTimeLevelProcessAndThreadOnEachLine) {
  const auto sink = makeLogSink(targets());
  ASSERT_NE(sink, nullptr);
  sink->write(LogLevel::Default, "[DEBUG] ┏1 asked url for d:1");
  sink->write(LogLevel::Error, "[ERROR] second");
  const auto lines = linesOf(file_);
  ASSERT_EQ(lines.size(), 2U);
  const std::string thread = std::to_string(getpid()) + ":" + std::to_string(gettid());
  const std::string time = R"(\d{4}-\d\d-\d\dT\d\d:\d\d:\d\d\.\d{6}Z )";
  EXPECT_TRUE(std::regex_match(lines[0], std::regex(time + "default zarn\\[" + thread +
                                                    "\\] \\[DEBUG\\] ┏1 asked url for d:1")))
      << lines[0];
  EXPECT_TRUE(std::regex_match(lines[1],
                               std::regex(time + "error zarn\\[" + thread + "\\] .ERROR. second")))
      << lines[1];
}

TEST_F(FileSinkTest, WritesImportantLinesOutAtOnce) {
  const auto sink = makeLogSink(targets());
  for (const auto level : {LogLevel::Default, LogLevel::Error, LogLevel::Fault}) {
    const auto before = linesOf(file_).size();
    sink->write(level, "important");
    EXPECT_EQ(linesOf(file_).size(), before + 1) << logLevelName(level);
  }
}

TEST_F(FileSinkTest, WritesTheOtherLinesOutAtTheEnd) {
  makeLogSink(targets())->write(LogLevel::Debug, "small");
  ASSERT_EQ(linesOf(file_).size(), 1U);
  EXPECT_NE(linesOf(file_)[0].find(" debug zarn["), std::string::npos);
}

TEST_F(FileSinkTest, LetsNoNameForgeALine) {
  const auto sink = makeLogSink(targets());
  sink->write(LogLevel::Error, "a\nb\x1b[31m\x7f{}%v\t");
  const auto lines = linesOf(file_);
  ASSERT_EQ(lines.size(), 1U);
  EXPECT_TRUE(lines[0].ends_with(R"(] a\nb\x1b[31m\x7f{}%v\x09)")) << lines[0];
}

TEST_F(FileSinkTest, KeepsThreeFilesOfBoundedSize) {
  const auto sink = makeLogSink(targets());
  const std::string line(1024 * 1024, 'x');
  for (int i = 0; i < 45; ++i) sink->write(LogLevel::Error, line);
  std::size_t files = 0;
  for (const auto& entry : std::filesystem::directory_iterator(directory_.path())) {
    EXPECT_LE(entry.file_size(), std::size_t{10} * 1024 * 1024) << entry.path();
    EXPECT_EQ(entry.path().extension(), ".log");
    ++files;
  }
  EXPECT_EQ(files, 3U);
}

TEST_F(FileSinkTest, SaysWhyAFileCannotBeOpened) {
  const std::ofstream file(directory_ / "file");
  NSErrorRef error;
  EXPECT_EQ(makeLogSink({.program = "zarn", .directory = directory_ / "file"}, &error), nullptr);
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSFileWriteUnknownError));
}

TEST(StandardErrorSinkTest, WritesToStandardError) {
  testing::internal::CaptureStderr();
  makeLogSink({.program = "host", .standardError = true})->write(LogLevel::Fault, "down");
  const auto text = testing::internal::GetCapturedStderr();
  EXPECT_NE(text.find(" fault host["), std::string::npos) << text;
  EXPECT_TRUE(text.ends_with("] down\n")) << text;
}

TEST(JournalSinkTest, WritesUnderItsIdentifier) {
  if (!logsToJournal()) GTEST_SKIP() << "this machine runs no journal";
  const auto sink = makeLogSink({.program = "test", .journalIdentifier = "yomber-test-0"});
  ASSERT_NE(sink, nullptr);
  sink->write(LogLevel::Info, "from the unit test");
}

TEST(OpenLogTest, WritesTheDefaultLogBelowTheHomeAndFollowsTheSharedLevel) {
  if (logsToJournal()) GTEST_SKIP() << "this machine logs to its journal";
  const TemporaryDirectory directory;
  unsetenv("XDG_RUNTIME_DIR");
  unsetenv("YOMBER_LOG_STDERR");
  const auto paths = DrivePaths::forHome(directory / "home");
  ASSERT_EQ(paths.create(), nullptr);
  openLog("zarn", paths);
  log_debug(defaultLog(), "unseen");
  ASSERT_EQ(setSharedLogLevel(paths, LogLevel::Debug), nullptr);
  log_debug(defaultLog(), "seen %d", 1);
  log_error(defaultLog(), "end");  // written out at once, with what was before it
  const auto lines = linesOf(paths.log + "/zarn.log");
  ASSERT_EQ(lines.size(), 2U);
  EXPECT_TRUE(lines[0].ends_with("seen 1"));
  defaultLog().setSink(nullptr);
  defaultLog().attachLevel(nullptr);
}

TEST(OpenLogTest, NamesProgramAndDriveInTheJournalIdentifier) {
  const auto paths = DrivePaths::forHome("/nowhere");
  EXPECT_EQ(journalIdentifier("zarn", paths), "yomber-zarn-" + paths.homeHash);
}

}  // namespace
}  // namespace yomber
