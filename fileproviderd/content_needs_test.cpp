#include "fileproviderd/content_needs.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <deque>
#include <memory>
#include <string>
#include <utility>
#include <vector>

namespace yomber {
namespace {

/// An extension that answers when the test says so.
class FakeSource final : public ContentSource {
 public:
  void startProviding(const Request& request, Handler handler) override {
    calls.push_back("start " + request.path +
                    (request.options != 0 ? " " + std::to_string(request.options) : ""));
    isWanted = request.isWanted;
    starts.push_back(std::move(handler));
  }
  void stopProviding(const std::string& path, Handler handler) override {
    calls.push_back("stop " + path);
    stops.push_back(std::move(handler));
  }
  void isGone(const std::string&, std::function<void(bool)> handler) override {
    looks.push_back(std::move(handler));
  }

  void answerStart(const NSErrorRef& error = nullptr) { take(starts)(error); }
  void answerStop() { take(stops)(nullptr); }
  void answerLook(bool isGone) { take(looks)(isGone); }
  void grant() {
    answerStart();
    answerLook(false);
  }
  [[nodiscard]] std::vector<std::string> takeCalls() { return std::exchange(calls, {}); }

  std::vector<std::string> calls;
  std::function<bool()> isWanted;  ///< what was asked for last
  std::deque<Handler> starts;
  std::deque<Handler> stops;
  std::deque<std::function<void(bool)>> looks;

 private:
  template <typename Function>
  static Function take(std::deque<Function>& from) {
    EXPECT_FALSE(from.empty());
    auto first = std::move(from.front());
    from.pop_front();
    return first;
  }
};

/// How often, and with what, a handler was called.
struct Answers {
  int count = 0;
  NSErrorRef error;
  ContentNeeds::Handler handler() {
    return [this](NSErrorRef given) {
      ++count;
      error = std::move(given);
    };
  }
};

using Calls = std::vector<std::string>;

class ContentNeedsTest : public testing::Test {
 protected:
  FakeSource source_;
  std::shared_ptr<ContentNeeds> needs_ = ContentNeeds::create(source_, {.needs = 8, .rounds = 3});
};

NSErrorRef cancelled() {
  return NSError::errorWithDomain(NSCocoaErrorDomain, NSUserCancelledError);
}

TEST_F(ContentNeedsTest, AsksOnceForAllWhoNeedTheSame) {
  Answers first;
  Answers second;
  const auto one = needs_->need("/a", 0, first.handler());
  const auto two = needs_->need("/a", 0, second.handler());
  EXPECT_EQ(source_.takeCalls(), Calls{"start /a"});
  source_.grant();
  EXPECT_EQ(first.count, 1);
  EXPECT_EQ(source_.takeCalls(), Calls{"start /a"}) << "the second came while it was under way";
  source_.grant();
  EXPECT_EQ(second.count, 1);
  EXPECT_EQ(needs_->count(), 2U);
}

TEST_F(ContentNeedsTest, AsksWithTheOptionsOfWhoeverWaits) {
  Answers answers;
  const auto one = needs_->need("/a", 0, answers.handler());
  const auto two = needs_->need("/a", 0x20000, answers.handler());
  const auto three = needs_->need("/a", 0, answers.handler());
  source_.grant();
  EXPECT_EQ(source_.takeCalls(), (Calls{"start /a", "start /a 131072"}));
  source_.grant();
  EXPECT_EQ(answers.count, 3);
}

TEST_F(ContentNeedsTest, NobodyIsAskedToGiveUpWhatSomebodyNeeds) {
  Answers granted;
  Answers stopped;
  auto need = needs_->need("/a", 0, granted.handler());
  needs_->stop("/a", stopped.handler());
  EXPECT_TRUE(stopped.error->is(NSPOSIXErrorDomain, EBUSY));
  source_.grant();
  needs_->stop("/a", stopped.handler());
  EXPECT_EQ(stopped.count, 2);
  EXPECT_EQ(source_.takeCalls(), Calls{"start /a"});
  need = nullptr;
  EXPECT_TRUE(source_.takeCalls().empty()) << "what is here stays until it is to go";
  needs_->stop("/a", stopped.handler());
  EXPECT_EQ(source_.takeCalls(), Calls{"stop /a"});
  source_.answerStop();
  EXPECT_EQ(stopped.count, 3);
  EXPECT_EQ(stopped.error, nullptr);
}

TEST_F(ContentNeedsTest, TheLastOneToLeaveEndsWhatIsUnderWay) {
  Answers answers;
  auto one = needs_->need("/a", 0, answers.handler());
  auto two = needs_->need("/a", 0, answers.handler());
  one = nullptr;
  EXPECT_EQ(source_.takeCalls(), Calls{"start /a"});
  two = nullptr;
  EXPECT_EQ(source_.takeCalls(), Calls{"stop /a"});
  source_.answerStart(cancelled());
  source_.answerStop();
  EXPECT_EQ(answers.count, 0) << "who has left is told nothing";
  EXPECT_EQ(needs_->count(), 0U);
}

TEST_F(ContentNeedsTest, WhatWasGivenUpIsNotWantedAlsoWhenSomebodyElseComes) {
  Answers answers;
  auto one = needs_->need("/a", 0, answers.handler());
  auto two = needs_->need("/a", 0, answers.handler());
  one = nullptr;
  EXPECT_TRUE(source_.isWanted());
  two = nullptr;
  EXPECT_FALSE(source_.isWanted());
  const auto late = needs_->need("/a", 0, answers.handler());
  EXPECT_FALSE(source_.isWanted()) << "the late one gets a request of its own";
  source_.answerStart(cancelled());
  source_.answerStop();
  EXPECT_TRUE(source_.isWanted());
}

TEST_F(ContentNeedsTest, WhoComesAfterItWasGivenUpIsNotCancelledWithIt) {
  Answers answers;
  auto early = needs_->need("/a", 0, answers.handler());
  early = nullptr;
  const auto late = needs_->need("/a", 0, answers.handler());
  EXPECT_EQ(source_.takeCalls(), (Calls{"start /a", "stop /a"}));
  source_.answerStop();
  source_.answerStart(cancelled());
  EXPECT_EQ(answers.count, 0);
  EXPECT_EQ(source_.takeCalls(), Calls{"start /a"});
  source_.grant();
  EXPECT_EQ(answers.count, 1);
  EXPECT_EQ(answers.error, nullptr);
}

TEST_F(ContentNeedsTest, WhoComesAfterItWasGivenUpTooLateWaitsUntilItIsGone) {
  Answers answers;
  auto early = needs_->need("/a", 0, answers.handler());
  early = nullptr;
  const auto late = needs_->need("/a", 0, answers.handler());
  EXPECT_EQ(source_.takeCalls(), (Calls{"start /a", "stop /a"}));
  source_.answerStart();
  EXPECT_TRUE(source_.takeCalls().empty()) << "the stop would take what is brought now";
  source_.answerStop();
  EXPECT_EQ(source_.takeCalls(), Calls{"start /a"});
  source_.grant();
  EXPECT_EQ(answers.count, 1);
  EXPECT_EQ(answers.error, nullptr);
}

TEST_F(ContentNeedsTest, WhoComesAfterItWasGivenUpBeforeTheLookWaitsUntilItIsGone) {
  Answers answers;
  auto early = needs_->need("/a", 0, answers.handler());
  source_.answerStart();
  early = nullptr;
  const auto late = needs_->need("/a", 0, answers.handler());
  source_.answerLook(false);
  EXPECT_EQ(source_.takeCalls(), (Calls{"start /a", "stop /a"}));
  source_.answerStop();
  EXPECT_EQ(source_.takeCalls(), Calls{"start /a"});
  source_.grant();
  EXPECT_EQ(answers.count, 1);
}

TEST_F(ContentNeedsTest, WhoComesDuringAStopWaitsForItsEnd) {
  Answers stopped;
  Answers granted;
  needs_->stop("/a", stopped.handler());
  const auto need = needs_->need("/a", 0, granted.handler());
  EXPECT_EQ(source_.takeCalls(), Calls{"stop /a"});
  source_.answerStop();
  EXPECT_EQ(stopped.error, nullptr);
  EXPECT_EQ(source_.takeCalls(), Calls{"start /a"});
  source_.grant();
  EXPECT_EQ(granted.count, 1);
}

TEST_F(ContentNeedsTest, AStopThatWaitedGivesWayToANeed) {
  Answers first;
  Answers second;
  Answers granted;
  needs_->stop("/a", first.handler());
  needs_->stop("/a", second.handler());
  const auto need = needs_->need("/a", 0, granted.handler());
  source_.answerStop();
  EXPECT_EQ(first.error, nullptr);
  EXPECT_TRUE(second.error->is(NSPOSIXErrorDomain, EBUSY));
  EXPECT_EQ(source_.takeCalls(), (Calls{"stop /a", "start /a"}));
}

TEST_F(ContentNeedsTest, AsksAgainForWhatIsGoneAgainButNotForEver) {
  Answers answers;
  const auto need = needs_->need("/a", 7, answers.handler());
  source_.answerStart();
  source_.answerLook(true);
  EXPECT_EQ(source_.takeCalls(), (Calls{"start /a 7", "start /a 7"}));
  source_.grant();
  EXPECT_EQ(answers.count, 1);
  EXPECT_EQ(answers.error, nullptr);
  const auto other = needs_->need("/a", 0, answers.handler());
  for (int round = 0; round < 3; ++round) {
    source_.answerStart();
    source_.answerLook(true);
  }
  EXPECT_EQ(source_.takeCalls().size(), 3U);
  EXPECT_EQ(answers.count, 2);
  EXPECT_TRUE(answers.error->is(NSCocoaErrorDomain, NSUbiquitousFileUnavailableError));
}

TEST_F(ContentNeedsTest, TellsAllWhoWaitedWhyThereIsNoContent) {
  Answers answers;
  const auto one = needs_->need("/a", 0, answers.handler());
  source_.answerStart(NSError::errorWithErrno(ENOSPC));
  EXPECT_EQ(answers.count, 1);
  EXPECT_TRUE(answers.error->is(NSPOSIXErrorDomain, ENOSPC));
}

TEST_F(ContentNeedsTest, LocationsAreIndependent) {
  Answers answers;
  const auto one = needs_->need("/a", 0, answers.handler());
  needs_->stop("/b", answers.handler());
  EXPECT_EQ(source_.takeCalls(), (Calls{"start /a", "stop /b"}));
}

TEST_F(ContentNeedsTest, TakesOnlySoMany) {
  std::vector<ContentNeeds::NeedRef> held;
  Answers answers;
  for (int i = 0; i < 8; ++i) held.push_back(needs_->need("/a", 0, answers.handler()));
  EXPECT_EQ(needs_->need("/a", 0, answers.handler()), nullptr);
  held.pop_back();
  EXPECT_NE(needs_->need("/a", 0, answers.handler()), nullptr);
}

TEST_F(ContentNeedsTest, MayEndWithTheirOwner) {
  Answers answers;
  auto need = needs_->need("/a", 0, answers.handler());
  needs_ = nullptr;
  source_.answerStart();
  need = nullptr;
  EXPECT_EQ(answers.count, 0);
}

TEST_F(ContentNeedsTest, AHandlerMayLetGoOfItsNeed) {
  ContentNeeds::NeedRef need;
  need = needs_->need("/a", 0, [&](const NSErrorRef&) { need = nullptr; });
  source_.grant();
  EXPECT_EQ(need, nullptr);
  EXPECT_EQ(needs_->count(), 0U);
}

}  // namespace
}  // namespace yomber
