#include "platform/foundation/log_level.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <fstream>
#include <thread>

#include "platform/foundation/temporary_directory.h"

namespace yomber {
namespace {

class LogLevelPageTest : public testing::Test {
 protected:
  void putFile(const std::string& bytes, mode_t mode = 0600) {
    std::ofstream(path_) << bytes;
    ASSERT_EQ(chmod(path_.c_str(), mode), 0);
  }
  /// Opens the page and proves that it works between two mappings.
  void expectWorks() {
    NSErrorRef error;
    const auto first = LogLevelPage::open(path_, &error);
    ASSERT_NE(first, nullptr) << error->description();
    const auto second = LogLevelPage::open(path_, &error);
    ASSERT_NE(second, nullptr) << error->description();
    EXPECT_EQ(first->level(), LogLevel::Info);
    second->setLevel(LogLevel::Debug);
    EXPECT_EQ(first->level(), LogLevel::Debug);
  }

  TemporaryDirectory directory_;
  const std::string path_ = directory_ / "log-level";
};

TEST_F(LogLevelPageTest, IsMadeWhenItIsMissing) {
  expectWorks();
  struct stat status{};
  ASSERT_EQ(stat(path_.c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 0777U, 0600U);
}

TEST_F(LogLevelPageTest, KeepsItsLevelFromOneOpeningToTheNext) {
  LogLevelPage::open(path_)->setLevel(LogLevel::Error);
  EXPECT_EQ(LogLevelPage::open(path_)->level(), LogLevel::Error);
}

TEST_F(LogLevelPageTest, ReplacesAFileThatIsTooShort) {
  putFile("yomberL1");
  expectWorks();
}

TEST_F(LogLevelPageTest, ReplacesAFileOfSomethingElse) {
  putFile(std::string(4096, 'x'));
  expectWorks();
}

TEST_F(LogLevelPageTest, ReplacesAPageWithALevelThatDoesNotExist) {
  std::string bytes(4096, '\0');
  bytes.replace(0, 9, "yomberL1\x07");
  putFile(bytes);
  expectWorks();
}

TEST_F(LogLevelPageTest, ReplacesAPageThatOthersMayWrite) {
  LogLevelPage::open(path_)->setLevel(LogLevel::Fault);
  ASSERT_EQ(chmod(path_.c_str(), 0666), 0);
  expectWorks();
}

TEST_F(LogLevelPageTest, ReplacesASymbolicLinkAndLeavesItsTargetAlone) {
  const std::string target = directory_ / "target";
  std::ofstream(target) << "precious";
  ASSERT_EQ(symlink(target.c_str(), path_.c_str()), 0);
  expectWorks();
  std::string content;
  std::ifstream(target) >> content;
  EXPECT_EQ(content, "precious");
}

TEST_F(LogLevelPageTest, SaysWhyItCannotBeOpened) {
  NSErrorRef error;
  EXPECT_EQ(LogLevelPage::open(directory_ / "missing/log-level", &error), nullptr);
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(NSPOSIXErrorDomain, ENOENT)) << error->description();
}

TEST_F(LogLevelPageTest, IsOnePageForAllWhoOpenItTogether) {
  std::vector<std::unique_ptr<LogLevelPage>> pages(8);
  std::vector<std::thread> threads;
  for (auto& page : pages) threads.emplace_back([&] { page = LogLevelPage::open(path_); });
  for (auto& thread : threads) thread.join();
  pages.front()->setLevel(LogLevel::Fault);
  for (const auto& page : pages) EXPECT_EQ(page->level(), LogLevel::Fault);
}

TEST_F(LogLevelPageTest, SwitchesTheLogOfAnotherProcess) {
  std::array<int, 2> ready{};
  std::array<int, 2> go{};
  ASSERT_EQ(pipe(ready.data()), 0);
  ASSERT_EQ(pipe(go.data()), 0);
  const pid_t child = fork();
  if (child == 0) {
    const auto page = LogLevelPage::open(path_);
    Log log;
    log.attachLevel(page->cell());
    const bool before = log.isEnabled(LogLevel::Debug);
    char byte = 'r';
    if (write(ready[1], &byte, 1) != 1 || read(go[0], &byte, 1) != 1) _exit(9);
    _exit(!before && log.isEnabled(LogLevel::Debug) ? 0 : 1);
  }
  char byte = 0;
  ASSERT_EQ(read(ready[0], &byte, 1), 1);
  LogLevelPage::open(path_)->setLevel(LogLevel::Debug);
  ASSERT_EQ(write(go[1], &byte, 1), 1);
  int status = -1;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  EXPECT_EQ(status, 0);
  for (const int descriptor : {ready[0], ready[1], go[0], go[1]}) close(descriptor);
}

TEST(LogLevelNameTest, NamesEveryLevelBothWays) {
  for (const auto level :
       {LogLevel::Debug, LogLevel::Info, LogLevel::Default, LogLevel::Error, LogLevel::Fault}) {
    EXPECT_EQ(logLevelNamed(logLevelName(level)), level);
  }
  EXPECT_EQ(logLevelNamed("loud"), std::nullopt);
}

TEST(SharedLogLevelTest, ReachesWhoeverHasTheDrivesPageOpen) {
  const TemporaryDirectory directory;
  unsetenv("XDG_RUNTIME_DIR");
  const auto paths = DrivePaths::forHome(directory.path());
  ASSERT_EQ(paths.create(), nullptr);
  const auto page = LogLevelPage::open(paths.logLevelPage);
  ASSERT_EQ(setSharedLogLevel(paths, LogLevel::Debug), nullptr);
  EXPECT_EQ(page->level(), LogLevel::Debug);
}

TEST(SharedLogLevelTest, IsRefusedWhereThereIsNoDrive) {
  const TemporaryDirectory directory;
  const auto paths = DrivePaths::forHome(directory / "none");
  EXPECT_NE(setSharedLogLevel(paths, LogLevel::Debug), nullptr);
  EXPECT_FALSE(std::filesystem::exists(paths.home));
}

}  // namespace
}  // namespace yomber
