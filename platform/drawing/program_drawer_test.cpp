#include "platform/drawing/program_drawer.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/file.h>

#include <cerrno>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>

#include "platform/foundation/temporary_directory.h"

namespace yomber {
namespace {

using Command = std::vector<std::string>;

class ProgramDrawerTest : public testing::Test {
 protected:
  void SetUp() override { std::ofstream(film_) << "a film"; }

  /// What the program has drawn; empty with `error_` when it has not.
  std::string drawn(const Command& command, const ProgramDrawer::Options& options = {}) {
    error_ = nullptr;
    const FileDescriptor file =
        ProgramDrawer(options).draw(command, film_, "holiday.mp4", 256, &error_);
    EXPECT_EQ(static_cast<bool>(file), error_ == nullptr);
    if (!file) return {};
    std::ifstream result("/proc/self/fd/" + std::to_string(file.get()));
    return {std::istreambuf_iterator<char>(result), {}};
  }
  static Command shell(const std::string& script) { return {"sh", "-c", script}; }

  [[nodiscard]] bool hasDrawnNothing() const {
    return error_ && error_->is(NSCocoaErrorDomain, NSFileReadCorruptFileError);
  }

  TemporaryDirectory directory_;
  const std::string film_ = directory_ / "content";
  NSErrorRef error_;
};

TEST_F(ProgramDrawerTest, AProgramIsGivenTheFileTheResultAndTheSize) {
  EXPECT_EQ(drawn({"cp", "%i", "%o"}), "a film");
  EXPECT_EQ(drawn(shell("echo %i %u %s 100%% > %o")), "/input.mp4 file:///input.mp4 256 100%\n");
}

TEST_F(ProgramDrawerTest, WhatAKilledProcessLeftIsRemoved) {
  namespace fs = std::filesystem;
  const char* const before = getenv("TMPDIR");
  const std::string own = before == nullptr ? std::string() : before;
  setenv("TMPDIR", directory_.path().c_str(), 1);
  const std::string left = directory_ / "yomber-drawing.left00";
  const std::string used = directory_ / "yomber-drawing.used00";
  const std::string others = directory_ / "drawing.txt";
  for (const std::string& path : {left, used, others}) std::ofstream(path) << "x";
  const FileDescriptor user(open(used.c_str(), O_RDWR | O_CLOEXEC));
  ASSERT_EQ(flock(user.get(), LOCK_EX | LOCK_NB), 0);
  EXPECT_EQ(drawn({"cp", "%i", "%o"}), "a film");
  EXPECT_FALSE(fs::exists(left));
  EXPECT_TRUE(fs::exists(used)) << "its process lives";
  EXPECT_TRUE(fs::exists(others));
  std::size_t results = 0;
  for (const auto& entry : fs::directory_iterator(directory_.path()))
    results += entry.path().filename().string().starts_with("yomber-drawing.") ? 1 : 0;
  EXPECT_EQ(results, 1U) << "our own is gone as well";
  if (own.empty()) {
    unsetenv("TMPDIR");
  } else {
    setenv("TMPDIR", own.c_str(), 1);
  }
}

TEST_F(ProgramDrawerTest, ItSeesNothingElse) {
  const std::string seen = drawn(shell("ls / /tmp /etc > %o; test -e " + film_ +
                                       " && echo film >> %o;"
                                       "env >> %o; true"));
  EXPECT_NE(seen.find("input.mp4"), std::string::npos);
  for (const char* const hidden : {"home", "root", "film", "passwd", "YOMBER", "DBUS"})
    EXPECT_EQ(seen.find(hidden), std::string::npos) << seen;
}

TEST_F(ProgramDrawerTest, ItReachesNoNetworkAndNoOtherProcess) {
  const std::string seen =
      drawn(shell("grep -c : /proc/net/dev > %o; ls -d /proc/[0-9]* | wc -l >> %o"));
  const std::size_t end = seen.find('\n');
  EXPECT_EQ(seen.substr(0, end), "1") << "the loopback alone: " << seen;
  EXPECT_LE(std::stoi(seen.substr(end + 1)), 6) << seen;
}

TEST_F(ProgramDrawerTest, ItCanChangeNothing) {
  EXPECT_EQ(drawn(shell("echo no > %i; touch /usr/lib/x; cp %i %o")), "a film");
  std::ifstream film(film_);
  EXPECT_EQ(std::string(std::istreambuf_iterator<char>(film), {}), "a film");
  EXPECT_FALSE(std::filesystem::exists("/usr/lib/x"));
}

TEST_F(ProgramDrawerTest, ItCannotTakeMoreRights) {
  EXPECT_EQ(drawn(shell("mount -o remount,rw,bind /usr; mount -o remount,rw,bind %i;"
                        "echo no > %i; touch /usr/lib/x /output/x; unshare -U true && exit 1;"
                        "cp %i %o")),
            "a film");
  EXPECT_FALSE(std::filesystem::exists("/usr/lib/x"));
  EXPECT_EQ(drawn(shell("grep CapEff /proc/self/status > %o")), "CapEff:\t0000000000000000\n");
}

TEST_F(ProgramDrawerTest, ItCannotFillTheMachine) {
  ProgramDrawer::Options options;
  options.fileSize = 1 << 20;
  const std::string seen =
      drawn(shell("for n in 1 2 3; do head -c 900000 /dev/zero > /tmp/$n; done;"
                  "for n in 1 2 3; do head -c 900000 /dev/zero > /dev/shm/$n; done;"
                  "touch /x /dev/x; for f in /tmp /dev/shm; do b=$(du -sb $f | cut -f1);"
                  " test $b -le 1100000 && echo ok; done > %o; ls /x /dev/x >> %o; true"),
            options);
  EXPECT_EQ(seen, "ok\nok\n");
}

TEST_F(ProgramDrawerTest, OneThatDiesOfTheFileMayBeTriedAgain) {
  EXPECT_EQ(drawn(shell("kill -SEGV $$")), "");
  EXPECT_TRUE(error_ && error_->is(NSPOSIXErrorDomain, EIO));
}

TEST_F(ProgramDrawerTest, OneThatIsNotThereIsNotTheFilesFault) {
  for (const char* const program : {"no-such-program", "/nowhere/film"}) {
    EXPECT_EQ(drawn({program, "%i", "%o"}), "") << program;
    EXPECT_TRUE(error_ && error_->is(NSPOSIXErrorDomain, ENOEXEC)) << program;
  }
}

TEST_F(ProgramDrawerTest, OneThatTakesTooLongIsKilled) {
  ProgramDrawer::Options options;
  options.patience = std::chrono::milliseconds(200);
  EXPECT_EQ(drawn({"tail", "-f", "/dev/null"}, options), "");
  EXPECT_TRUE(error_ && error_->is(NSPOSIXErrorDomain, ETIME));
}

TEST_F(ProgramDrawerTest, OneThatWritesTooMuchIsKilled) {
  ProgramDrawer::Options options;
  options.fileSize = 1 << 20;
  EXPECT_EQ(drawn(shell("head -c 2000000 /dev/zero > %o"), options), "");
  EXPECT_TRUE(error_ && error_->is(NSPOSIXErrorDomain, EIO));
}

TEST_F(ProgramDrawerTest, OneThatFailsOrLeavesNoFileHasDrawnNothing) {
  for (const Command& command :
       {Command{"false"}, Command{"true"}, shell(": > %o"), shell("cp %i %o; exit 1")}) {
    EXPECT_EQ(drawn(command), "") << command.back();
    EXPECT_TRUE(hasDrawnNothing()) << command.back();
  }
}

TEST_F(ProgramDrawerTest, WithoutWhatConfinesThemNoProgramIsRun) {
  ProgramDrawer::Options options;
  EXPECT_TRUE(ProgramDrawer(options).isAvailable());
  options.confiner = "/nowhere/bwrap";
  EXPECT_FALSE(ProgramDrawer(options).isAvailable());
  EXPECT_EQ(drawn({"cp", "%i", "%o"}, options), "");
  EXPECT_TRUE(error_ && error_->is(NSPOSIXErrorDomain, ENOEXEC));
}

TEST_F(ProgramDrawerTest, AConfinerThatCannotWorkHereIsNotTheFilesFault) {
  ProgramDrawer::Options options;
  options.confiner = "/usr/bin/false";
  EXPECT_EQ(drawn({"cp", "%i", "%o"}, options), "");
  EXPECT_TRUE(error_ && error_->is(NSPOSIXErrorDomain, ENOEXEC));
}

}  // namespace
}  // namespace yomber
