#include "mount/request_loop.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdlib>
#include <memory>
#include <string>

#include "platform/foundation/gate.h"

namespace yomber {
namespace {

/// Requests of one byte, through a pipe. "Long" ones say so; what an answer does, the test says.
class RequestLoopTest : public ::testing::Test {
 protected:
  static constexpr unsigned kThreads = 4;

  RequestLoopTest() { EXPECT_EQ(pipe2(pipe_.data(), O_NONBLOCK | O_CLOEXEC), 0); }
  ~RequestLoopTest() override {
    endRequests();
    if (thread_.joinable()) thread_.join();
    close(pipe_[0]);
  }

  void start(std::function<void(char)> answer) {
    loop_ = std::make_unique<RequestLoop>(
        RequestLoop::Source{
            .device = pipe_[0],
            .receive =
                [this](fuse_buf& buffer) {
                  if (buffer.mem == nullptr) buffer.mem = malloc(1);
                  const ssize_t count = ::read(pipe_[0], buffer.mem, 1);
                  return count < 0 ? -errno : static_cast<int>(count);
                },
            .answer = [answer = std::move(answer)](
                          const fuse_buf& buffer) { answer(*static_cast<char*>(buffer.mem)); },
            .mayTakeLong =
                [](const fuse_buf& buffer) { return *static_cast<char*>(buffer.mem) == kLong; }},
        kThreads);
    thread_ = std::thread([this] { result_ = loop_->run(); });
  }
  void request(const std::string& requests) {
    ASSERT_EQ(write(pipe_[1], requests.data(), requests.size()), ssize_t(requests.size()));
  }
  void endRequests() {
    if (pipe_[1] >= 0) close(pipe_[1]);
    pipe_[1] = -1;
  }
  int result() {
    endRequests();
    thread_.join();
    return result_;
  }

  static constexpr char kLong = 'L';
  std::array<int, 2> pipe_{-1, -1};
  std::unique_ptr<RequestLoop> loop_;
  std::thread thread_;
  int result_ = -1;
};

TEST_F(RequestLoopTest, EveryRequestIsAnsweredOnce) {
  constexpr int kRequests = 20'000;
  std::atomic<int> answered = 0;
  Gate all;
  start([&](char) {
    if (++answered == kRequests) all.open();
  });
  for (int i = 0; i < kRequests; ++i) request(i % 7 == 0 ? "L" : "s");
  EXPECT_TRUE(all.wait());
  EXPECT_EQ(result(), 0);
  EXPECT_EQ(answered, kRequests);
}

TEST_F(RequestLoopTest, WhatIsReadAtTheEndIsAnsweredStill) {
  std::atomic<int> answered = 0;
  request(std::string(100, 's'));
  endRequests();
  start([&](char) { ++answered; });
  EXPECT_EQ(result(), 0);
  EXPECT_EQ(answered, 100);
}

TEST_F(RequestLoopTest, OneThatTurnsOutToBeLongHoldsUpNoOthers) {
  Gate mayEnd;
  Gate others;
  start([&](char which) {
    if (which == 'b') {
      EXPECT_TRUE(mayEnd.wait());
    } else {
      others.open();
    }
  });
  request("b");
  request("s");
  EXPECT_TRUE(others.wait(1));
  // And again, when somebody else has the turn.
  request("b");
  request("s");
  EXPECT_TRUE(others.wait(2));
  mayEnd.open();
  EXPECT_EQ(result(), 0);
}

TEST_F(RequestLoopTest, AsManyLongOnesAsThereAreThreadsAreAnsweredTogether) {
  Gate together;
  start([&](char which) {
    together.open();
    if (which == kLong) {
      EXPECT_TRUE(together.wait(kThreads));
    }
  });
  request(std::string(kThreads, kLong));
  EXPECT_TRUE(together.wait(kThreads));
  EXPECT_EQ(result(), 0);
}

TEST_F(RequestLoopTest, ADeviceThatFailsEndsItWithTheReason) {
  loop_ = std::make_unique<RequestLoop>(
      RequestLoop::Source{.device = pipe_[0],
                          .receive = [](fuse_buf&) { return -EIO; },
                          .answer = [](const fuse_buf&) {},
                          .mayTakeLong = [](const fuse_buf&) { return false; }},
      kThreads);
  EXPECT_EQ(loop_->run(), EIO);
}

/// In a process of its own, for which the system makes no threads any more.
[[noreturn]] void answerAlone(unsigned mostThreads) {
  const rlimit none{.rlim_cur = 0, .rlim_max = 0};
  constexpr uid_t kNobody = 65534;
  if (setrlimit(RLIMIT_NPROC, &none) != 0 || (geteuid() == 0 && setuid(kNobody) != 0)) _exit(1);
  const std::string requests = "sLsLLs";
  std::size_t next = 0;
  std::string answered;
  RequestLoop loop(
      {.device = -1,
       .receive =
           [&](fuse_buf& buffer) {
             if (next == requests.size()) return 0;
             if (buffer.mem == nullptr) buffer.mem = malloc(1);
             *static_cast<char*>(buffer.mem) = requests[next++];
             return 1;
           },
       .answer = [&](const fuse_buf& buffer) { answered += *static_cast<char*>(buffer.mem); },
       .mayTakeLong =
           [](const fuse_buf& buffer) { return *static_cast<char*>(buffer.mem) == 'L'; }},
      mostThreads);
  _exit(loop.run() == 0 && answered == requests ? 0 : 3);
}

TEST_F(RequestLoopTest, WhereThereAreNoMoreThreadsOneAnswersAll) {
  EXPECT_EXIT(answerAlone(kThreads), ::testing::ExitedWithCode(0), "");
}

}  // namespace
}  // namespace yomber
