// Who waits for content: until when, and what becomes of them when somebody stops, or they are
// interrupted.
#include <algorithm>
#include <array>
#include <atomic>
#include <cerrno>
#include <csignal>
#include <filesystem>
#include <fstream>
#include <memory>
#include <new>
#include <stdexcept>
#include <string>
#include <vector>

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/time.h>
#include <sys/wait.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "platform/foundation/fault_attributes.h"
#include "platform/foundation/stopped_process.h"
#include "tests/harness/aside.h"
#include "tests/harness/file_contents.h"
#include "tests/harness/mount_fixture.h"

namespace yomber::testing {
namespace {

namespace fs = std::filesystem;
using Process = TestDrive::Process;

constexpr std::size_t kSize = 50'000;
constexpr off_t kInside = 30'000;
constexpr const char* kCopying = "zarn.fill.copying";

int readOneByte(const std::string& path) {
  const OpenedFile file(path, O_RDONLY);
  char byte = 0;
  return static_cast<int>(pread(file.get(), &byte, 1, kInside));
}

/// A process of its own that does something.
class Child {
 public:
  template <typename Work>
  explicit Child(Work work) : pid_(fork()) {
    if (pid_ == 0) _exit(work());
  }
  ~Child() {
    if (pid_ > 0) (void)end();
  }
  Child(const Child&) = delete;
  Child& operator=(const Child&) = delete;

  [[nodiscard]] pid_t pid() const { return pid_; }
  [[nodiscard]] bool isWaiting() const {
    std::ifstream stack("/proc/" + std::to_string(pid_) + "/wchan");
    std::string where;
    stack >> where;
    return where.find("fuse") != std::string::npos || where.find("request") != std::string::npos;
  }
  /// Kills it; how it ended, as waitpid(2) says.
  int end() {
    ::kill(pid_, SIGKILL);
    return result();
  }
  int result() {
    int status = 0;
    (void)waitpid(pid_, &status, 0);
    pid_ = -1;
    return status;
  }

 private:
  pid_t pid_;
};

// --- Somebody who has stopped.

class WhenOneStops : public MountFixture {
 protected:
  explicit WhenOneStops(const std::vector<std::string>& gates = {})
      : MountFixture(gates, {}, {{"YOMBER_DAEMON_TIMEOUT_MS", "4000"}}) {}

  /// While a reader waits, until it fails. Not so often that what nobody takes of it is too much.
  void expectTheRestToGoOn(Aside& reading) {
    constexpr int kMost = 100;
    for (int i = 0; i < kMost && !HasFailure() && (i == 0 || !reading.isDone()); ++i) {
      EXPECT_EQ(fs::file_size(at("away")), kSize);
      EXPECT_EQ(contentOf(at("here")), "here");
      EXPECT_GE(std::distance(fs::directory_iterator(mounted_.folder()), fs::directory_iterator()),
                2);
      std::ofstream(at("new")) << "new";
      EXPECT_EQ(contentOf(at("new")), "new");
      fs::remove(at("new"));
    }
  }
  void expectAReadToFailWithoutIt(Process process) {
    makeAway("away", content_);
    std::ofstream(at("here")) << "here";
    const OpenedFile file(at("away"), O_RDONLY);
    {
      auto stopped = std::make_unique<StoppedProcess>(mounted_.drive().pidOf(process));
      Aside reading([&] {
        char byte = 0;
        return static_cast<int>(pread(file.get(), &byte, 1, kInside));
      });
      EXPECT_TRUE(eventually([&] { return reading.isAsked(); }));
      expectTheRestToGoOn(reading);
      EXPECT_TRUE(eventually([&] { return reading.isDone(); }));
      stopped.reset();
      EXPECT_EQ(reading.result(), EIO);
    }
    EXPECT_TRUE(eventually([&] { return file.read(kSize, 0) == content_; }));
  }

  const std::string content_ = someContent(kSize, 1);
};

TEST_F(WhenOneStops, AReadThatNeedsTheDaemonFailsAndTheRestGoesOn) {
  expectAReadToFailWithoutIt(Process::Zarn);
}

TEST_F(WhenOneStops, AReadThatNeedsTheExtensionFailsAndTheRestGoesOn) {
  expectAReadToFailWithoutIt(Process::Extension);
}

class WhenNoBytesCome : public WhenOneStops {
 protected:
  WhenNoBytesCome() : WhenOneStops({kCopying}) {}
};

TEST_F(WhenNoBytesCome, AReadFailsAndALaterOneGetsThem) {
  makeAway("away", content_);
  Aside reading([&] { return readOneByte(at("away")); });
  EXPECT_TRUE(eventually([&] { return mounted_.isReached(kCopying); }));
  EXPECT_TRUE(eventually([&] { return reading.isDone(); }));
  mounted_.openGate(kCopying);
  EXPECT_EQ(reading.result(), EIO);
  EXPECT_TRUE(eventually([&] { return contentOf(at("away")) == content_; }));
}

// --- Many who wait.

class ManyWhoWait : public MountFixture {};

TEST_F(ManyWhoWait, AreInterruptedAtOnce) {
  constexpr int kReaders = 600;
  fs::create_directory(at("d"));
  const auto path = [&](int number) { return at("d/" + std::to_string(number)); };
  for (int i = 0; i <= kReaders; ++i) std::ofstream(path(i)) << someContent(kSize, 1);
  EXPECT_TRUE(eventually([&] {
    (void)mounted_.drive().yomber({"evict", "d"});
    return isAway("d/0") && isAway("d/" + std::to_string(kReaders));
  }));
  for (int i = 0; i <= kReaders; ++i)
    ASSERT_TRUE(eventually([&] { return isAway("d/" + std::to_string(i)); }));
  // Nobody starts the host again.
  const StoppedProcess supervisor(mounted_.drive().status()["supervisor"]["pid"].get<pid_t>());
  mounted_.drive().kill(Process::Host);
  std::vector<std::unique_ptr<Aside>> readers;
  for (int i = 0; i < kReaders; ++i) {
    readers.push_back(std::make_unique<Aside>([&, i] { return readOneByte(path(i)); }));
  }
  EXPECT_TRUE(eventually([&] {
    return std::all_of(readers.begin(), readers.end(),
                       [](const auto& reader) { return reader->isAsked(); });
  }));
  const std::string last = path(kReaders);
  Child child([&] { return readOneByte(last); });
  EXPECT_TRUE(eventually([&] { return child.isWaiting(); }));
  EXPECT_TRUE(WIFSIGNALED(child.end()));
  const auto isDone = [](const auto& reader) { return reader->isDone(); };
  EXPECT_EQ(std::count_if(readers.begin(), readers.end(), isDone), 0);
  for (const auto& reader : readers) EXPECT_EQ(reader->result(), EIO);
}

// --- Who is interrupted.

constexpr const char* kTakenBack = "zarn.wish.taken-back";
constexpr const char* kVerified = "zarn.fill.verified";

/// What a child and the test both see.
struct Counts {
  std::atomic<int> interruptions = 0;
};
Counts* counts = nullptr;

void handle(int signal, int flags) {
  struct sigaction action{};
  action.sa_handler = [](int) {};
  action.sa_flags = flags;
  (void)sigaction(signal, &action, nullptr);
}

class Interrupted : public MountFixture {
 protected:
  Interrupted() : MountFixture({kCopying, kTakenBack, kVerified}) {
    mounted_.openGate(kTakenBack);
    mounted_.openGate(kVerified);
    void* const memory =
        mmap(nullptr, sizeof(Counts), PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0);
    if (memory == MAP_FAILED) throw std::runtime_error("no memory");
    counts = new (memory) Counts;
    makeAway("away", content_);
    path_ = at("away");
  }
  ~Interrupted() override { munmap(counts, sizeof(Counts)); }

  /// The content is about to be copied for the child.
  void waitForFilling(const Child& reader) {
    ASSERT_TRUE(eventually([&] { return mounted_.isReached(kCopying); }));
    ASSERT_TRUE(eventually([&] { return reader.isWaiting(); }));
  }

  const std::string content_ = someContent(kSize, 1);
  std::string path_;
};

TEST_F(Interrupted, ByATimerAReaderWhoTriesAgainGetsTheContentNevertheless) {
  Child reader([&] {
    handle(SIGALRM, SA_RESTART);
    const itimerval every{.it_interval = {0, 20'000}, .it_value = {0, 20'000}};
    (void)setitimer(ITIMER_REAL, &every, nullptr);
    while (readOneByte(path_) != 1) {
      if (errno != EINTR) return 1;
      ++counts->interruptions;
    }
    return 0;
  });
  waitForFilling(reader);
  const int before = counts->interruptions;
  EXPECT_TRUE(eventually([&] { return counts->interruptions >= before + 10; }));
  mounted_.openGate(kCopying);
  EXPECT_EQ(reader.result(), 0);
  EXPECT_FALSE(mounted_.isReached(kTakenBack));
}

TEST_F(Interrupted, ByASignalThatIsHandledAReaderIsTold) {
  Child reader([&] {
    handle(SIGUSR1, 0);
    return readOneByte(path_) < 0 && errno == EINTR ? 0 : 1;
  });
  waitForFilling(reader);
  ::kill(reader.pid(), SIGUSR1);
  EXPECT_EQ(reader.result(), 0);
}

TEST_F(Interrupted, ByItsEndTheLastReaderHasTheProvidingStopped) {
  Child reader([&] { return readOneByte(path_); });
  waitForFilling(reader);
  EXPECT_TRUE(WIFSIGNALED(reader.end()));
  EXPECT_TRUE(eventually([&] { return mounted_.isReached(kTakenBack); }));
  mounted_.openGate(kCopying);
  EXPECT_TRUE(eventually([&] { return isAway("away"); }));
  EXPECT_FALSE(mounted_.isReached(kVerified));
  EXPECT_EQ(contentOf(path_), content_);
}

TEST_F(Interrupted, ByItsEndAReaderLeavesTheProvidingToTheNext) {
  Child reader([&] { return readOneByte(path_); });
  waitForFilling(reader);
  EXPECT_TRUE(WIFSIGNALED(reader.end()));
  Aside next([&] { return readOneByte(path_); });
  EXPECT_TRUE(eventually([&] { return next.isAsked(); }));
  mounted_.openGate(kCopying);
  EXPECT_EQ(next.result(), 0);
  EXPECT_FALSE(mounted_.isReached(kTakenBack));
}

// --- Who waits for the disk.

constexpr const char* kDisk = "mount.disk.waited";

class WhenTheDiskIsSlow : public MountFixture {
 protected:
  /// What was filled is not settled by the daemon.
  WhenTheDiskIsSlow() : MountFixture({kDisk, "zarn.settle.synced"}) {}

  /// A document that was away, and was read.
  void makeFilled(const std::string& name) {
    makeAway(name, someContent(kSize, 1));
    EXPECT_EQ(contentOf(at(name)), someContent(kSize, 1));
    EXPECT_GE(getxattr(onDisk(name).c_str(), kFaultAttribute, nullptr, 0), 0);
  }
};

TEST_F(WhenTheDiskIsSlow, WhoWaitsForItHoldsUpNobodyElse) {
  constexpr int kWaiting = 30;
  constexpr int kFilled = 10;
  std::ofstream(at("here")) << "here";
  for (int i = 0; i < kFilled; ++i) makeFilled("filled" + std::to_string(i));
  std::vector<std::unique_ptr<OpenedFile>> files;
  std::vector<std::unique_ptr<Aside>> waiting;
  const auto wait = [&](std::function<int()> call) {
    waiting.push_back(std::make_unique<Aside>(std::move(call)));
  };
  for (int i = 0; i < kWaiting; ++i) {
    // The kernel locks a folder that it has synced.
    const std::string path = at("d" + std::to_string(i));
    fs::create_directory(path);
    std::ofstream(path + "/written") << i;
    files.push_back(std::make_unique<OpenedFile>(path + "/written", O_WRONLY));
    wait([file = files.back()->get()] { return fsync(file); });
    files.push_back(std::make_unique<OpenedFile>(path, O_RDONLY | O_DIRECTORY));
    wait([file = files.back()->get()] { return fsync(file); });
  }
  for (int i = 0; i < kFilled; ++i) {
    wait([path = at("filled" + std::to_string(i))] { return OpenedFile(path, O_WRONLY).get(); });
  }
  EXPECT_TRUE(eventually([&] {
    return std::all_of(waiting.begin(), waiting.end(),
                       [](const auto& each) { return each->isAsked(); });
  }));
  EXPECT_TRUE(mounted_.isReached(kDisk));
  Aside others([&] {
    std::ofstream(at("new")) << "new";
    const bool isRead = contentOf(at("here")) == "here" && contentOf(at("new")) == "new";
    const auto listed =
        std::distance(fs::directory_iterator(mounted_.folder()), fs::directory_iterator());
    return isRead && listed > kWaiting && fs::remove(at("new")) ? 0 : -1;
  });
  EXPECT_TRUE(eventually([&] { return others.isDone(); }));
  for (const auto& each : waiting) EXPECT_FALSE(each->isDone());
  mounted_.openGate(kDisk);
  EXPECT_EQ(others.result(), 0);
  for (const auto& each : waiting) EXPECT_EQ(each->result(), 0);
}

// --- Somebody who is killed.

class WhenOneIsKilled : public MountFixture, public ::testing::WithParamInterface<Process> {
 protected:
  WhenOneIsKilled() : MountFixture({kCopying}) { makeAway("away", content_); }

  /// Once somebody waits for content that is about to be copied.
  void killOne() {
    EXPECT_TRUE(eventually([&] { return mounted_.isReached(kCopying); }));
    mounted_.drive().kill(GetParam());
    mounted_.openGate(kCopying);
  }
  const std::string content_ = someContent(kSize, 1);
};

TEST_P(WhenOneIsKilled, AReaderGetsTheContentOrIsToldThatItDoesNotCome) {
  std::string read;
  const OpenedFile file(at("away"), O_RDONLY);
  Aside reading([&] {
    std::string bytes(kSize, 0);
    const ssize_t count = pread(file.get(), bytes.data(), bytes.size(), 0);
    if (count > 0) read = bytes.substr(0, static_cast<std::size_t>(count));
    return static_cast<int>(count);
  });
  killOne();
  EXPECT_TRUE(eventually([&] { return reading.isDone(); }));
  const int result = reading.result();
  if (result == 0) {
    EXPECT_EQ(read, content_);
  } else {
    EXPECT_EQ(result, EIO);
  }
  EXPECT_TRUE(eventually([&] { return contentOf(at("away")) == content_; }));
}

TEST_P(WhenOneIsKilled, WhoWaitsForAPageOfAMapGetsItOrASignal) {
  constexpr int kFailed = 7;
  const std::string path = at("away");
  Child reader([&] {
    struct sigaction action{};
    action.sa_handler = [](int) { _exit(kFailed); };
    (void)sigaction(SIGBUS, &action, nullptr);
    const OpenedFile file(path, O_RDONLY);
    const void* const bytes = mmap(nullptr, kSize, PROT_READ, MAP_SHARED, file.get(), 0);
    if (bytes == MAP_FAILED) return 1;
    return static_cast<const volatile char*>(bytes)[kInside] == content_[kInside] ? 0 : 2;
  });
  killOne();
  siginfo_t end{};
  EXPECT_TRUE(eventually([&] {
    (void)waitid(P_PID, static_cast<id_t>(reader.pid()), &end, WEXITED | WNOWAIT | WNOHANG);
    return end.si_pid != 0;
  }));
  const int status = reader.end();
  EXPECT_TRUE(WIFEXITED(status) && (WEXITSTATUS(status) == 0 || WEXITSTATUS(status) == kFailed));
  EXPECT_TRUE(eventually([&] { return contentOf(path) == content_; }));
}

std::string nameOf(const ::testing::TestParamInfo<Process>& tested) {
  const std::array<std::string, 3> names{"Daemon", "Host", "Extension"};
  return names[static_cast<std::size_t>(tested.param)];
}

INSTANTIATE_TEST_SUITE_P(All, WhenOneIsKilled,
                         ::testing::Values(Process::Host, Process::Extension, Process::Zarn),
                         nameOf);

}  // namespace
}  // namespace yomber::testing
