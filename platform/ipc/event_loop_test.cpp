#include "platform/ipc/event_loop.h"

#include <gtest/gtest.h>

#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "platform/ipc/deadlines.h"
#include "platform/ipc/gate.h"
#include "platform/ipc/remote.h"
#include "platform/ipc/test_echo_server.h"

namespace yomber::ipc {
namespace {

using std::chrono::milliseconds;

EventLoop& loop() { return EventLoop::shared(); }

TEST(EventLoop, RunsPostedWorkInOrderOnItsThread) {
  std::vector<int> order;
  bool elsewhere = false;
  for (int i = 0; i < 100; ++i) {
    loop().post([&, i] {
      order.push_back(i);
      elsewhere |= !loop().isCurrent();
    });
  }
  loop().runAndWait([] {});
  ASSERT_EQ(order.size(), 100U);
  for (int i = 0; i < 100; ++i) EXPECT_EQ(order[static_cast<std::size_t>(i)], i);
  EXPECT_FALSE(elsewhere);
  EXPECT_FALSE(loop().isCurrent());
}

TEST(EventLoop, TakesWorkFromManyThreads) {
  constexpr std::uint64_t kThreads = 8;
  constexpr std::uint64_t kEach = 2000;
  std::uint64_t sum = 0;  // touched on the loop thread only
  std::vector<std::thread> threads;
  for (std::uint64_t t = 0; t < kThreads; ++t) {
    threads.emplace_back([&] {
      for (std::uint64_t i = 0; i < kEach; ++i) loop().post([&] { ++sum; });
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(loop().runAndWait([&] { return sum; }), kThreads * kEach);
}

TEST(EventLoop, RunsWorkThatWorkPosts) {
  Gate done;
  loop().post([&] { loop().post([&] { done.open(); }); });
  done.wait();
}

TEST(EventLoop, SurvivesWorkThatThrows) {
  loop().post([] { throw std::runtime_error("thrown by a test"); });
  EXPECT_EQ(loop().runAndWait([] { return 7; }), 7);
}

TEST(EventLoop, RunAndWaitThrowsWhatTheWorkThrew) {
  try {
    loop().runAndWait([]() -> int { throw std::runtime_error("from the loop"); });
    FAIL() << "nothing was thrown";
  } catch (const std::runtime_error& error) {
    EXPECT_STREQ(error.what(), "from the loop");
  }
}

TEST(EventLoopDeathTest, WaitingOnTheLoopThreadAborts) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(loop().runAndWait([] { loop().runAndWait([] {}); }),
               "runAndWait must not be called on the loop thread");
}

TEST(EventLoopDeathTest, LoopThingsElsewhereAbort) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(loop().timer(), "timer must be called on the loop thread");
}

TEST(EventLoop, RetiredObjectsGoSoonAndOnTheLoopThread) {
  struct Witness {
    Gate& gone;
    bool& onLoop;
    ~Witness() {
      onLoop = loop().isCurrent();
      gone.open();
    }
  };
  Gate gone;
  bool onLoop = false;
  loop().runAndWait([&] { loop().retire(std::shared_ptr<Witness>(new Witness{gone, onLoop})); });
  gone.wait();  // by the timer: nothing else wakes the loop
  EXPECT_TRUE(onLoop);
}

TEST(Deadlines, ExpireInOrderAndOnlyWhenNotCleared) {
  Deadlines::Entry late;
  Deadlines::Entry early;
  Deadlines::Entry cleared;
  std::string order;
  Gate done;
  loop().runAndWait([&] {
    loop().deadlines().set(late, milliseconds(30), [&] {
      order += "late";
      done.open();
    });
    loop().deadlines().set(cleared, milliseconds(15), [&] { order += "cleared "; });
    loop().deadlines().set(early, milliseconds(5), [&] { order += "early "; });
    cleared.clear();
  });
  done.wait();
  EXPECT_EQ(order, "early late");
}

TEST(Deadlines, AnEntryCanBeSetAgainWhenItExpires) {
  Deadlines::Entry entry;
  int rounds = 0;
  Gate done;
  std::function<void()> again = [&] {
    if (++rounds == 3) return done.open();
    loop().deadlines().set(entry, milliseconds(1), again);
  };
  loop().runAndWait([&] { loop().deadlines().set(entry, milliseconds(1), again); });
  done.wait();
  EXPECT_EQ(rounds, 3);
}

TEST(Remote, NilAndEquality) {
  Remote<test::Echo> nil;
  EXPECT_FALSE(nil);
  EXPECT_EQ(nil, Remote<test::Echo>(nullptr));
  const auto state = std::make_shared<test::EchoState>();
  const auto made = loop().runAndWait(
      [&] { return Remote<test::Echo>(test::makeEcho(state).castAs<test::Echo>()); });
  const auto copy = made;
  EXPECT_TRUE(made);
  EXPECT_EQ(made, copy);
  EXPECT_NE(made, nil);
}

TEST(Remote, TheLastCopyMayBeDroppedAnywhere) {
  const auto state = std::make_shared<test::EchoState>();
  auto remote = loop().runAndWait(
      [&] { return Remote<test::Echo>(test::makeEcho(state).castAs<test::Echo>()); });
  {
    std::vector<std::thread> threads;
    for (int i = 0; i < 4; ++i) threads.emplace_back([copy = remote] { EXPECT_TRUE(copy); });
    remote = nullptr;
    for (auto& thread : threads) thread.join();
  }
  EXPECT_TRUE(state->destroyed.waitFor(1));
  EXPECT_EQ(state->destroyedOffLoop.value(), 0U);
}

}  // namespace
}  // namespace yomber::ipc
