#include "platform/ipc/server_call.h"

#include <gtest/gtest.h>

#include <stdexcept>
#include <string>
#include <vector>

#include "platform/ipc/call.h"
#include "platform/ipc/test_echo_server.h"

namespace yomber::ipc {
namespace {

using test::Echo;

/// Keeps a promise on the loop thread and notes how it ends.
class Watched {
 public:
  template <typename Make>
  explicit Watched(Make make) {
    EventLoop::shared().runAndWait([&] {
      promise_ = make()
                     .then([this](auto&&...) { done.add(); })
                     .eagerlyEvaluate([this](kj::Exception&& exception) {
                       text = exception.getDescription().cStr();
                       failed.add();
                     });
    });
  }
  ~Watched() { drop(); }
  void drop() {
    EventLoop::shared().runAndWait([&] { promise_ = nullptr; });
  }

  test::Tally done;
  test::Tally failed;
  std::string text;

 private:
  kj::Maybe<kj::Promise<void>> promise_;
};

TEST(ServerCall, TheResultComesBackToTheLoopThread) {
  bool onPoolThread = false;
  bool backOnLoop = false;
  int value = 0;
  Watched watched([&] {
    return onPool([&](const CancelFlag& cancelled) {
             onPoolThread = !EventLoop::shared().isCurrent() && !cancelled.isSet();
             return std::make_unique<int>(17);
           })
        .then([&](std::unique_ptr<int> result) {
          backOnLoop = EventLoop::shared().isCurrent();
          value = *result;
        });
  });
  ASSERT_TRUE(watched.done.waitFor(1));
  EXPECT_TRUE(onPoolThread);
  EXPECT_TRUE(backOnLoop);
  EXPECT_EQ(value, 17);
}

TEST(ServerCall, WorkWithoutAResult) {
  Watched watched([] { return onPool([](const CancelFlag&) {}); });
  EXPECT_TRUE(watched.done.waitFor(1));
}

TEST(ServerCall, WhatTheWorkThrowsIsThePromisesException) {
  Watched watched([] {
    return onPool([](const CancelFlag&) -> int { throw std::runtime_error("thrown on the pool"); });
  });
  ASSERT_TRUE(watched.failed.waitFor(1));
  EXPECT_NE(watched.text.find("thrown on the pool"), std::string::npos);
}

/// Notes on which thread the last copy of a result goes.
struct Witness {
  test::Tally& gone;
  bool& onLoop;
  ~Witness() {
    onLoop = EventLoop::shared().isCurrent();
    gone.add();
  }
};

TEST(ServerCall, ADroppedPromiseSetsTheFlagAndDiscardsTheResultOnTheLoop) {
  test::Tally started;
  test::Tally told;
  test::Tally gone;
  bool onLoop = false;
  bool sawFlag = false;
  Watched watched([&] {
    return onPool([&](const CancelFlag& cancelled) {
      cancelled.whenSet([&] { told.add(); });
      started.add();
      (void)told.waitFor(1);
      sawFlag = cancelled.isSet();
      return std::shared_ptr<Witness>(new Witness{gone, onLoop});
    });
  });
  ASSERT_TRUE(started.waitFor(1));
  watched.drop();
  ASSERT_TRUE(gone.waitFor(1));
  EXPECT_TRUE(sawFlag);
  EXPECT_TRUE(onLoop);
  EXPECT_EQ(watched.done.value(), 0U);
}

TEST(ServerCall, HandlersOfWorkThatEndedAreForgotten) {
  test::Tally called;
  Watched watched([&] {
    return onPool([&](const CancelFlag& cancelled) { cancelled.whenSet([&] { called.add(); }); });
  });
  ASSERT_TRUE(watched.done.waitFor(1));
  watched.drop();
  EXPECT_EQ(called.value(), 0U);
}

TEST(ServerCall, HandlersSetLateAreCalledToo) {
  CancelFlag flag;
  flag.set();
  test::Tally called;
  flag.whenSet([&] { called.add(); });
  EXPECT_TRUE(called.waitFor(1));
  EXPECT_TRUE(flag.isSet());
}

TEST(ServerCall, AQueueKeepsTheOrder) {
  const auto queue = SerialQueue::create("ipc.test");
  std::vector<int> order;
  bool onQueueAlways = true;
  {
    std::vector<std::unique_ptr<Watched>> calls;
    for (int i = 0; i < 20; ++i) {
      calls.push_back(std::make_unique<Watched>([&, i] {
        return onQueue(queue, [&, i](const CancelFlag&) {
          onQueueAlways &= queue->isCurrent();
          order.push_back(i);
          return i;
        });
      }));
    }
    for (auto& each : calls) ASSERT_TRUE(each->done.waitFor(1));
  }
  ASSERT_EQ(order.size(), 20U);
  for (int i = 0; i < 20; ++i) EXPECT_EQ(order[static_cast<std::size_t>(i)], i);
  EXPECT_TRUE(onQueueAlways);
}

TEST(ServerCall, AMethodAnswersFromThePool) {
  test::EchoPair pair;
  std::uint64_t value = 0;
  EXPECT_EQ(callAndWait(
                pair.echo, &Echo::Client::workRequest,
                [](Echo::WorkParams::Builder params) { params.setValue(4); },
                [&](Echo::WorkResults::Reader results) { value = results.getValue(); }),
            nullptr);
  EXPECT_EQ(value, 5U);
}

TEST(ServerCall, TheClientsCancellationReachesThePool) {
  test::EchoPair pair;
  test::Tally replies;
  const CallHandle handle = call(
      pair.echo, &Echo::Client::workRequest,
      [](Echo::WorkParams::Builder params) { params.setHold(true); },
      [&](const NSErrorRef&, const Echo::WorkResults::Reader*) { replies.add(); });
  ASSERT_TRUE(pair.state->works.waitFor(1));
  handle.cancel();
  EXPECT_TRUE(pair.state->cancelledWorks.waitFor(1));
  EXPECT_TRUE(replies.waitFor(1));
}

TEST(ServerCall, ADisconnectReachesThePool) {
  test::EchoPair pair;
  call(
      pair.echo, &Echo::Client::workRequest,
      [](Echo::WorkParams::Builder params) { params.setHold(true); },
      [](const NSErrorRef&, const Echo::WorkResults::Reader*) {});
  ASSERT_TRUE(pair.state->works.waitFor(1));
  pair.client = nullptr;
  EXPECT_TRUE(pair.state->cancelledWorks.waitFor(1));
}

}  // namespace
}  // namespace yomber::ipc
