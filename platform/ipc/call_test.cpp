#include "platform/ipc/call.h"

#include <gtest/gtest.h>

#include <atomic>
#include <csignal>
#include <cstring>
#include <memory>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "platform/ipc/message_stream.h"
#include "platform/ipc/test_echo_server.h"

namespace yomber::ipc {
namespace {

using std::chrono::milliseconds;
using test::Counter;
using test::Echo;
using test::EchoPair;

const auto kNothing = [](auto) {};

/// The outcome of an asynchronous call, waited for.
struct Outcome {
  test::Tally replies;
  NSErrorRef error;
  bool hadResults = false;

  template <typename Reader>
  void set(NSErrorRef failure, const Reader* results) {
    error = std::move(failure);
    hadResults = results != nullptr;
    replies.add();
  }
};

CallHandle hang(const Remote<Echo>& echo, Outcome& outcome, CallOptions options = {}) {
  return call(
      echo, &Echo::Client::hangRequest, kNothing,
      [&outcome](NSErrorRef error, const Echo::HangResults::Reader* results) {
        outcome.set(std::move(error), results);
      },
      options);
}

/// Runs everything that is on the loop now, so that a second reply would have shown.
void settle() {
  for (int i = 0; i < 3; ++i) EventLoop::shared().runAndWait([] {});
}

TEST(Call, RoundTrip) {
  EchoPair pair;
  std::uint64_t value = 0;
  std::string data;
  const NSErrorRef error = callAndWait(
      pair.echo, &Echo::Client::echoRequest,
      [](Echo::EchoParams::Builder params) {
        params.setValue(42);
        params.setData(kj::StringPtr("some bytes").asBytes());
      },
      [&](Echo::EchoResults::Reader results) {
        value = results.getValue();
        data.assign(reinterpret_cast<const char*>(results.getData().begin()),
                    results.getData().size());
      });
  EXPECT_EQ(error, nullptr);
  EXPECT_EQ(value, 42U);
  EXPECT_EQ(data, "some bytes");
}

TEST(Call, EightThreadsGetTheirOwnAnswers) {
  EchoPair pair;
  std::atomic<int> wrong{0};
  std::vector<std::thread> threads;
  for (std::uint64_t t = 0; t < 8; ++t) {
    threads.emplace_back([&, t] {
      for (std::uint64_t i = 0; i < 300; ++i) {
        if (!test::echoes(pair.echo, t * 1000 + i)) ++wrong;
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(wrong, 0);
}

TEST(Call, OneThreadsCallsArriveInOrder) {
  EchoPair pair;
  Remote<Counter> counter;
  EXPECT_EQ(callAndWait(pair.echo, &Echo::Client::makeCounterRequest, kNothing,
                        [&](Echo::MakeCounterResults::Reader results) {
                          counter = Remote<Counter>(results.getCounter());
                        }),
            nullptr);
  std::vector<std::uint64_t> totals;
  test::Tally replies;
  for (std::uint64_t i = 1; i <= 50; ++i) {
    call(
        counter, &Counter::Client::addRequest,
        [i](Counter::AddParams::Builder params) { params.setAmount(i); },
        [&](const NSErrorRef&, const Counter::AddResults::Reader* results) {
          totals.push_back(results != nullptr ? results->getTotal() : 0);
          replies.add();
        });
  }
  ASSERT_TRUE(replies.waitFor(50));
  for (std::uint64_t i = 1; i <= 50; ++i) EXPECT_EQ(totals[i - 1], i * (i + 1) / 2);
  counter = nullptr;
  EXPECT_TRUE(pair.state->destroyed.waitFor(1)) << "a dropped capability is released at its owner";
}

TEST(Call, NilRemoteIsAnErrorAtOnce) {
  EXPECT_TRUE(test::isCocoaError(test::echoOnce(nullptr), NSXPCConnectionInvalid));
  Outcome outcome;
  hang(nullptr, outcome);
  ASSERT_TRUE(outcome.replies.waitFor(1));
  EXPECT_TRUE(test::isCocoaError(outcome.error, NSXPCConnectionInvalid));
  EXPECT_FALSE(outcome.hadResults);
}

/// Overwrites memory that the calling thread freed a moment ago, whatever its size.
void overwriteFreedMemory() {
  constexpr std::size_t kStep = 16;
  std::vector<std::unique_ptr<char[]>> taken;
  for (std::size_t size = kStep; size <= 64 * kStep; size += kStep) {
    for (int i = 0; i < 8; ++i) taken.push_back(std::make_unique<char[]>(size));
  }
}

TEST(Call, CancellingACallOfNilRightAwayEndsItOnce) {
  Gate closed;
  EventLoop::shared().post([&] { closed.wait(); });
  Outcome outcome;
  hang(nullptr, outcome).cancel();
  EventLoop::shared().post(overwriteFreedMemory);
  closed.open();
  ASSERT_TRUE(outcome.replies.waitFor(1));
  settle();
  EXPECT_EQ(outcome.replies.value(), 1U);
  EXPECT_NE(outcome.error, nullptr);
}

TEST(Call, OnTheLoopThreadTheReplyComesAfterTheReturn) {
  Outcome outcome;
  bool returned = false;
  bool order = false;
  EventLoop::shared().runAndWait([&] {
    call(Remote<Echo>(), &Echo::Client::hangRequest, kNothing,
         [&](const NSErrorRef& error, const Echo::HangResults::Reader* results) {
           order = returned;
           outcome.set(error, results);
         });
    returned = true;
  });
  ASSERT_TRUE(outcome.replies.waitFor(1));
  EXPECT_TRUE(order);
}

TEST(Call, TheServersExceptionIsTheErrorsText) {
  EchoPair pair;
  const NSErrorRef error = callAndWait(
      pair.echo, &Echo::Client::failRequest,
      [](Echo::FailParams::Builder params) { params.setReason("the reason of a test"); }, kNothing);
  ASSERT_TRUE(test::isCocoaError(error, NSXPCConnectionReplyInvalid));
  EXPECT_NE(error->localizedDescription().find("the reason of a test"), std::string::npos);
  EXPECT_TRUE(test::echoes(pair.echo, 1));
}

TEST(Call, ThrowingClosuresBecomeErrors) {
  EchoPair pair;
  const auto throwing = [](auto) { throw std::runtime_error("thrown by a closure"); };
  NSErrorRef error = callAndWait(pair.echo, &Echo::Client::echoRequest, throwing, kNothing);
  EXPECT_TRUE(test::isCocoaError(error, NSXPCConnectionReplyInvalid));
  error = callAndWait(pair.echo, &Echo::Client::echoRequest, kNothing, throwing);
  ASSERT_TRUE(test::isCocoaError(error, NSXPCConnectionReplyInvalid));
  EXPECT_EQ(error->localizedDescription(), "thrown by a closure");
  call(pair.echo, &Echo::Client::echoRequest, kNothing,
       [](const NSErrorRef&, const Echo::EchoResults::Reader*) {
         throw std::runtime_error("thrown by a reply handler");
       });
  EXPECT_TRUE(test::echoes(pair.echo, 1));
}

TEST(Call, ACancelledCallEndsOnceAndThePeerIsTold) {
  EchoPair pair;
  Outcome outcome;
  const CallHandle handle = hang(pair.echo, outcome);
  ASSERT_TRUE(pair.state->hangs.waitFor(1));
  handle.cancel();
  handle.cancel();
  ASSERT_TRUE(outcome.replies.waitFor(1));
  EXPECT_TRUE(test::isCocoaError(outcome.error, NSUserCancelledError));
  EXPECT_TRUE(pair.state->cancelled.waitFor(1));
  settle();
  EXPECT_EQ(outcome.replies.value(), 1U);
}

TEST(Call, CancellingAnAnsweredCallDoesNothing) {
  EchoPair pair;
  Outcome outcome;
  const CallHandle handle = call(pair.echo, &Echo::Client::echoRequest, kNothing,
                                 [&](NSErrorRef error, const Echo::EchoResults::Reader* results) {
                                   outcome.set(std::move(error), results);
                                 });
  ASSERT_TRUE(outcome.replies.waitFor(1));
  handle.cancel();
  CallHandle().cancel();
  settle();
  EXPECT_EQ(outcome.replies.value(), 1U);
  EXPECT_EQ(outcome.error, nullptr);
  EXPECT_TRUE(outcome.hadResults);
}

TEST(Call, AHandlerMayCancelItsOwnCall) {
  EchoPair pair;
  test::Tally replies;
  CallHandle handle;
  EventLoop::shared().runAndWait([&] {
    handle = call(pair.echo, &Echo::Client::echoRequest, kNothing,
                  [&](const NSErrorRef&, const Echo::EchoResults::Reader*) {
                    handle.cancel();
                    replies.add();
                  });
  });
  ASSERT_TRUE(replies.waitFor(1));
  settle();
  EXPECT_EQ(replies.value(), 1U);
}

TEST(Call, APeerThatDoesNotAnswerIsATimeOut) {
  EchoPair pair;
  const NSErrorRef error = callAndWait(pair.echo, &Echo::Client::hangRequest, kNothing, kNothing,
                                       {.timeout = milliseconds(30)});
  EXPECT_TRUE(test::isCocoaError(error, NSXPCConnectionTimedOut));
  EXPECT_TRUE(pair.state->cancelled.waitFor(1)) << "a call that timed out is cancelled at the peer";
  EXPECT_TRUE(test::echoes(pair.echo, 5)) << "the connection lives on";
}

TEST(Call, AStoppedPeerIsATimeOutAndLaterCallsWork) {
  test::TemporaryDirectory directory;
  test::EchoProcess peer(directory.file("echo"));
  NSErrorRef error;
  const auto connection = Connection::connect(directory.file("echo"), &error);
  ASSERT_NE(connection, nullptr) << error->description();
  const auto echo = connection->bootstrap<Echo>();
  ASSERT_TRUE(test::echoes(echo, 1));
  peer.signal(SIGSTOP);
  peer.awaitStop();
  EXPECT_TRUE(test::isCocoaError(test::echoOnce(echo, {.timeout = milliseconds(50)}),
                                 NSXPCConnectionTimedOut));
  EXPECT_TRUE(connection->isConnected());
  peer.signal(SIGCONT);
  EXPECT_TRUE(test::echoes(echo, 2));
}

TEST(Call, AKilledPeerFailsAllOutstandingCallsOnce) {
  test::TemporaryDirectory directory;
  test::EchoProcess peer(directory.file("echo"));
  const auto connection = Connection::connect(directory.file("echo"));
  ASSERT_NE(connection, nullptr);
  const auto echo = connection->bootstrap<Echo>();
  std::vector<Outcome> outcomes(20);
  for (auto& outcome : outcomes) hang(echo, outcome, {.timeout = milliseconds(0)});
  ASSERT_TRUE(test::echoes(echo, 1));
  test::Tally disconnects;
  NSErrorRef reason;
  connection->onDisconnect([&](NSErrorRef error) {
    reason = std::move(error);
    disconnects.add();
  });
  peer.signal(SIGKILL);
  for (auto& outcome : outcomes) {
    ASSERT_TRUE(outcome.replies.waitFor(1));
    EXPECT_TRUE(test::isCocoaError(outcome.error, NSXPCConnectionInterrupted));
  }
  ASSERT_TRUE(disconnects.waitFor(1));
  EXPECT_TRUE(test::isCocoaError(reason, NSXPCConnectionInterrupted));
  settle();
  for (auto& outcome : outcomes) EXPECT_EQ(outcome.replies.value(), 1U);
  EXPECT_EQ(disconnects.value(), 1U);
  EXPECT_FALSE(connection->isConnected());
  EXPECT_TRUE(test::isCocoaError(test::echoOnce(echo), NSXPCConnectionInterrupted));
}

TEST(Call, ClosingHereFailsOutstandingCallsOnce) {
  EchoPair pair;
  Outcome outcome;
  hang(pair.echo, outcome);
  ASSERT_TRUE(pair.state->hangs.waitFor(1));
  pair.client->close();
  ASSERT_TRUE(outcome.replies.waitFor(1));
  EXPECT_NE(outcome.error, nullptr);
  EXPECT_TRUE(pair.state->cancelled.waitFor(1)) << "the peer sees the end";
  settle();
  EXPECT_EQ(outcome.replies.value(), 1U);
}

TEST(Call, CallbacksReachTheCaller) {
  EchoPair pair;
  std::uint64_t sum = 0;
  const NSErrorRef error = callAndWait(
      pair.echo, &Echo::Client::callBackRequest,
      [](Echo::CallBackParams::Builder params) {
        params.setCallback(test::makeCallback(10));
        params.setTimes(4);
      },
      [&](Echo::CallBackResults::Reader results) { sum = results.getSum(); });
  EXPECT_EQ(error, nullptr);
  EXPECT_EQ(sum, 100U);
}

TEST(Call, DescriptorsTravelToTheCaller) {
  EchoPair pair;
  std::vector<test::Tally> done(8);
  std::vector<std::string> texts(8);
  // Mixed with calls that carry none, so that each must be matched with its own message.
  for (std::size_t i = 0; i < texts.size(); ++i) {
    call(
        pair.echo, &Echo::Client::openDescriptorRequest,
        [i](Echo::OpenDescriptorParams::Builder params) {
          params.setText("pipe " + std::to_string(i));
        },
        [&, i](const NSErrorRef&, const Echo::OpenDescriptorResults::Reader* results) {
          if (results == nullptr) return done[i].add();
          auto descriptor = results->getDescriptor();
          EventLoop::shared().detach(
              descriptor.getFd().then([&, i, descriptor](kj::Maybe<int> fd) mutable {
                KJ_IF_MAYBE (number, fd) {
                  const UniqueFd own = duplicateDescriptor(*number);
                  texts[i] = test::readAll(own.get());
                }
                done[i].add();
              }));
        });
    call(pair.echo, &Echo::Client::echoRequest, kNothing,
         [](const NSErrorRef&, const Echo::EchoResults::Reader*) {});
  }
  for (std::size_t i = 0; i < texts.size(); ++i) {
    ASSERT_TRUE(done[i].waitFor(1));
    EXPECT_EQ(texts[i], "pipe " + std::to_string(i));
  }
}

TEST(Call, DescriptorsTravelToThePeer) {
  test::TemporaryDirectory directory;
  test::EchoProcess peer(directory.file("echo"));
  const auto connection = Connection::connect(directory.file("echo"));
  ASSERT_NE(connection, nullptr);
  std::string text;
  const NSErrorRef error = callAndWait(
      connection->bootstrap<Echo>(), &Echo::Client::readDescriptorRequest,
      [](Echo::ReadDescriptorParams::Builder params) {
        params.setDescriptor(test::makeDescriptor(test::pipeHolding("over to you")));
      },
      [&](Echo::ReadDescriptorResults::Reader results) { text = results.getText().cStr(); });
  EXPECT_EQ(error, nullptr) << error->description();
  EXPECT_EQ(text, "over to you");
}

TEST(Call, LargeMessagesTravelBothWays) {
  EchoPair pair;
  constexpr std::size_t kBytes = 5'000'000;
  const auto sent = test::randomBytes(1, kBytes);
  bool same = false;
  const NSErrorRef error = callAndWait(
      pair.echo, &Echo::Client::echoRequest,
      [&](Echo::EchoParams::Builder params) {
        params.setData({reinterpret_cast<const kj::byte*>(sent.data()), sent.size()});
      },
      [&](Echo::EchoResults::Reader results) {
        const auto data = results.getData();
        same = data.size() == kBytes && std::memcmp(data.begin(), sent.data(), kBytes) == 0;
      });
  EXPECT_EQ(error, nullptr);
  EXPECT_TRUE(same);
}

TEST(Call, ATooLargeRequestIsRefusedAlone) {
  EchoPair pair;
  const NSErrorRef error = callAndWait(
      pair.echo, &Echo::Client::echoRequest,
      [](Echo::EchoParams::Builder params) { params.initData(65 * 1024 * 1024); }, kNothing);
  ASSERT_TRUE(test::isCocoaError(error, NSXPCConnectionReplyInvalid));
  EXPECT_NE(error->localizedDescription().find("send it in parts"), std::string::npos);
  EXPECT_TRUE(test::echoes(pair.echo, 3)) << "the connection lives on";
}

TEST(Call, ATooLargeReplyIsRefusedAlone) {
  EchoPair pair;
  const auto ask = [&](std::uint64_t bytes) {
    return callAndWait(
        pair.echo, &Echo::Client::largeRequest,
        [bytes](Echo::LargeParams::Builder params) { params.setBytes(bytes); }, kNothing);
  };
  const NSErrorRef error = ask(65ULL * 1024 * 1024);
  ASSERT_TRUE(test::isCocoaError(error, NSXPCConnectionReplyInvalid));
  EXPECT_NE(error->localizedDescription().find("size limit"), std::string::npos)
      << error->localizedDescription();
  EXPECT_EQ(ask(60ULL * 1024 * 1024), nullptr) << "the connection lives on";
}

TEST(CallDeathTest, WaitingOnTheLoopThreadAborts) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(EventLoop::shared().runAndWait([] { (void)test::echoOnce(nullptr); }),
               "callAndWait must not be called on the loop thread");
}

TEST(Call, RemotesAndConnectionsGoInAnyOrder) {
  for (int order = 0; order < 4; ++order) {
    EchoPair pair;
    ASSERT_TRUE(test::echoes(pair.echo, 1));
    Outcome outcome;
    const CallHandle handle = hang(pair.echo, outcome);
    if (order == 0) pair.echo = nullptr;
    if (order == 1) pair.server = nullptr;
    if (order == 2) pair.client = nullptr;
    if (order == 3) handle.cancel();
    pair.client = nullptr;
    pair.echo = nullptr;
    ASSERT_TRUE(outcome.replies.waitFor(1)) << order;
    EXPECT_NE(outcome.error, nullptr);
    pair.server = nullptr;
    EXPECT_TRUE(pair.state->destroyed.waitFor(1)) << order;
    EXPECT_EQ(pair.state->destroyedOffLoop.value(), 0U);
  }
}

}  // namespace
}  // namespace yomber::ipc
