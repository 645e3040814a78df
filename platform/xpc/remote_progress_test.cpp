// Progress across a connection: its counts come here, its cancellation goes there.

#include <gtest/gtest.h>

#include <chrono>
#include <string>
#include <thread>

#include "platform/ipc/gate.h"
#include "platform/xpc/connection_link.h"
#include "platform/xpc/test_workshop.h"

namespace yomber::test {
namespace {

NSErrorRef cancelledError() {
  return NSError::errorWithDomain(NSCocoaErrorDomain, NSUserCancelledError);
}

/// One piece of work that is under way, seen from both sides.
class RemoteProgress : public ::testing::Test {
 protected:
  void SetUp() override {
    workshop_.client->resume();
    progress_ = workshop_.proxy()->work(
        "job", [notes = replies_](const NSErrorRef& error) { notes->note(domainAndCode(error)); });
    ASSERT_NE(progress_, nullptr) << "a progress is there at once";
    object_ = workshop_.vendor->waitForObject();
    ASSERT_NE(object_, nullptr);
  }

  [[nodiscard]] bool waitForCounts(std::int64_t total, std::int64_t completed) const {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(30);
    while (progress_->totalUnitCount() != total || progress_->completedUnitCount() != completed) {
      if (std::chrono::steady_clock::now() > deadline) return false;
      std::this_thread::yield();
    }
    return true;
  }

  WorkshopConnection workshop_;
  NSProgressRef progress_;
  std::shared_ptr<WorkshopObject> object_;
  const std::shared_ptr<HandlerNotes> replies_ = std::make_shared<HandlerNotes>();
};

TEST_F(RemoteProgress, FollowsTheCounts) {
  EXPECT_TRUE(waitForCounts(4, 0));
  const auto job = object_->job("job");
  job.progress->setCompletedUnitCount(1);
  EXPECT_TRUE(waitForCounts(4, 1));
  job.progress->setTotalUnitCount(10);
  job.progress->setCompletedUnitCount(7);
  EXPECT_TRUE(waitForCounts(10, 7));
  object_->finish("job", nullptr);
  EXPECT_TRUE(replies_->waitFor(1));
}

TEST_F(RemoteProgress, TellsTheLastCountsBeforeTheReply) {
  constexpr int kRounds = 50;
  for (int round = 0; round < kRounds; ++round) {
    const std::string name = std::to_string(round);
    const auto seen = std::make_shared<ipc::Gate>();
    const auto counts = std::make_shared<std::int64_t>(-1);
    const auto mine = std::make_shared<NSProgressRef>();
    *mine = workshop_.proxy()->work(name, [=](const NSErrorRef&) {
      *counts = (*mine)->completedUnitCount();
      seen->open();
    });
    const auto job = object_->job(name);
    for (int i = 1; i <= 4; ++i) job.progress->setCompletedUnitCount(i);
    job.reply(nullptr);
    seen->wait();
    ASSERT_EQ(*counts, 4) << "in round " << round;
  }
}

TEST_F(RemoteProgress, ItsUpdateHandlerMayMakeCallsThatWait) {
  WorkshopConnection other;
  other.client->resume();
  const auto answers = std::make_shared<HandlerNotes>();
  progress_->setUpdateHandler(
      [&other, answers, queue = workshop_.client->link()->queue(), progress = progress_.get()] {
        if (progress->completedUnitCount() != 3) return;
        answers->note(std::to_string(other.addOne(1)) +
                      (queue->isCurrent() ? " on the queue" : " elsewhere"));
      });
  object_->job("job").progress->setCompletedUnitCount(3);
  ASSERT_TRUE(answers->waitFor(1));
  progress_->setUpdateHandler({});
  workshop_.client->link()->queue()->sync([] {});
  EXPECT_EQ(answers->all().front(), "2 on the queue");
}

TEST_F(RemoteProgress, FollowsCountsThatComeAfterTheReply) {
  object_->finish("job", nullptr);
  ASSERT_TRUE(replies_->waitFor(1));
  object_->job("job").progress->setCompletedUnitCount(4);
  EXPECT_TRUE(waitForCounts(4, 4));
}

TEST_F(RemoteProgress, CancellingItCancelsTheWorkWhoseReplyStillComes) {
  (void)object_->job("job");
  progress_->cancel();
  ASSERT_TRUE(object_->waitForCancelled("job"));
  EXPECT_TRUE(replies_->all().empty()) << "the work answers for itself";
  object_->finish("job", cancelledError());
  ASSERT_TRUE(replies_->waitFor(1));
  EXPECT_EQ(replies_->all(), (std::vector<std::string>{"NSCocoaErrorDomain 3072"}));
}

TEST_F(RemoteProgress, CancellingBeforeTheMethodWasCalledCancelsWhatItBegins) {
  const auto late = workshop_.proxy()->work("late", [](const NSErrorRef&) {});
  late->cancel();
  EXPECT_TRUE(object_->waitForCancelled("late"));
}

TEST_F(RemoteProgress, CancellingAfterTheReplyReachesAProgressThatIsStillThere) {
  object_->finish("job", nullptr);
  ASSERT_TRUE(replies_->waitFor(1));
  progress_->cancel();
  EXPECT_TRUE(object_->waitForCancelled("job"));
}

TEST_F(RemoteProgress, CancellingAfterTheEndDoesNothing) {
  workshop_.client->invalidate();
  ASSERT_TRUE(workshop_.handlers->waitFor(1));
  progress_->cancel();
  EXPECT_TRUE(progress_->isCancelled());
  object_->finish("job", nullptr);
}

TEST_F(RemoteProgress, DroppingItDoesNotCancelTheWork) {
  (void)object_->job("job");
  progress_ = nullptr;
  object_->finish("job", nullptr);
  ASSERT_TRUE(replies_->waitFor(1));
  EXPECT_FALSE(object_->job("job").isCancelled);
}

TEST_F(RemoteProgress, WorkGoesOnWhenTheClientIsGone) {
  const auto job = object_->job("job");
  workshop_.client->invalidate();
  ASSERT_TRUE(workshop_.vendor->handlers->waitFor(1));
  EXPECT_FALSE(object_->job("job").isCancelled);
  ASSERT_TRUE(workshop_.handlers->waitFor(1));
  job.progress->setCompletedUnitCount(4);
  job.reply(nullptr);
  // Whatever the reply did, it has done by the time that later calls have come round.
  WorkshopConnection later;
  later.client->resume();
  for (std::uint64_t i = 0; i < 3; ++i) ASSERT_EQ(later.addOne(i), i + 1);
  workshop_.client->link()->queue()->sync([] {});
  EXPECT_TRUE(replies_->all().empty());
  EXPECT_EQ(workshop_.failures->waitFor(1), true) << "the call has failed with the connection";
  EXPECT_EQ(workshop_.failures->all().size(), 1U);
}

}  // namespace
}  // namespace yomber::test
