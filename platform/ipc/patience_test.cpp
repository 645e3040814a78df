#include "platform/ipc/patience.h"

#include <gtest/gtest.h>

#include <string>
#include <thread>
#include <utility>

#include "platform/ipc/test_echo_server.h"

namespace yomber::ipc {
namespace {

using std::chrono::milliseconds;
using test::Echo;
using test::EchoPair;
using test::isCocoaError;

constexpr milliseconds kLimit{20};

/// A question that the peer answers, and how often it was asked.
Patience::Question counted(const Remote<Echo>& echo, test::Tally& asked) {
  return [&echo, &asked](const CallOptions& options, Patience::Answer answer) {
    asked.add();
    (void)call(
        echo, &Echo::Client::echoRequest, [](auto) {},
        [answer = std::move(answer)](const NSErrorRef& error, const auto*) { answer(error); },
        options);
  };
}

/// A question that is never answered.
Patience::Question inVain(const Remote<Echo>& echo) {
  return [&echo](const CallOptions& options, Patience::Answer answer) {
    (void)call(
        echo, &Echo::Client::hangRequest, [](auto) {},
        [answer = std::move(answer)](const NSErrorRef& error, const auto*) { answer(error); },
        options);
  };
}

TEST(Patience, WorkThatTakesLongIsWaitedForWhileThePeerAnswers) {
  EchoPair pair;
  test::Tally asked;
  std::thread releasing([&] {
    EXPECT_TRUE(asked.waitFor(5));
    pair.state->releaseWorks.add();
  });
  std::uint64_t value = 0;
  const NSErrorRef error = callAndWaitPatiently(
      pair.echo, &Echo::Client::workRequest,
      [](auto params) {
        params.setValue(41);
        params.setHold(true);
      },
      [&](auto results) { value = results.getValue(); }, kLimit, counted(pair.echo, asked));
  releasing.join();
  EXPECT_EQ(error, nullptr) << error->description();
  EXPECT_EQ(value, 42U);
}

TEST(Patience, APeerThatAnswersNothingEndsTheCallWithTheTimeOut) {
  EchoPair pair;
  const NSErrorRef error = callAndWaitPatiently(
      pair.echo, &Echo::Client::hangRequest, [](auto) {}, [](auto) { FAIL(); }, kLimit,
      inVain(pair.echo));
  EXPECT_TRUE(isCocoaError(error, NSXPCConnectionTimedOut));
  // It was told that nobody waits any longer: for the answer to the question, and for the work.
  EXPECT_TRUE(pair.state->cancelled.waitFor(2));
  EXPECT_TRUE(test::echoes(pair.echo, 7));
}

TEST(Patience, ALostConnectionEndsTheCallByItself) {
  EchoPair pair;
  std::thread closing([&] {
    EXPECT_TRUE(pair.state->hangs.waitFor(1));
    pair.server->close();
  });
  const NSErrorRef error = callAndWaitPatiently(
      pair.echo, &Echo::Client::hangRequest, [](auto) {}, [](auto) { FAIL(); },
      std::chrono::hours(1), inVain(pair.echo));
  closing.join();
  ASSERT_NE(error, nullptr);
  EXPECT_FALSE(error->is(NSCocoaErrorDomain, NSXPCConnectionTimedOut)) << error->description();
}

TEST(Patience, NilRemoteIsAnErrorAtOnce) {
  const Remote<Echo> nothing;
  const NSErrorRef error = callAndWaitPatiently(
      nothing, &Echo::Client::hangRequest, [](auto) {}, [](auto) { FAIL(); }, kLimit,
      inVain(nothing));
  EXPECT_TRUE(isCocoaError(error, NSXPCConnectionInvalid));
}

}  // namespace
}  // namespace yomber::ipc
