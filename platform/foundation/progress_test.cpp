#include "platform/foundation/progress.h"

#include <gtest/gtest.h>

#include <atomic>
#include <thread>
#include <vector>

namespace yomber {
namespace {

TEST(ProgressTest, CountsItsUnits) {
  const auto progress = NSProgress::progressWithTotalUnitCount(4);
  EXPECT_EQ(progress->totalUnitCount(), 4);
  EXPECT_EQ(progress->fractionCompleted(), 0);
  progress->setCompletedUnitCount(1);
  EXPECT_EQ(progress->completedUnitCount(), 1);
  EXPECT_EQ(progress->fractionCompleted(), 0.25);
  progress->setCompletedUnitCount(9);
  EXPECT_EQ(progress->fractionCompleted(), 1);
}

TEST(ProgressTest, KnowsNoFractionOfNothing) {
  const auto progress = NSProgress::progressWithTotalUnitCount(0);
  progress->setCompletedUnitCount(3);
  EXPECT_EQ(progress->fractionCompleted(), 0);
}

TEST(ProgressTest, CountsChildrenByTheirShare) {
  const auto parent = NSProgress::progressWithTotalUnitCount(10);
  const auto child = NSProgress::progressWithTotalUnitCount(100);
  parent->addChild(child, 5);
  parent->setCompletedUnitCount(2);
  child->setCompletedUnitCount(50);
  EXPECT_DOUBLE_EQ(parent->fractionCompleted(), 0.45);
}

TEST(ProgressTest, CallsTheCancellationHandlerOnce) {
  const auto progress = NSProgress::progressWithTotalUnitCount(0);
  int calls = 0;
  progress->setCancellationHandler([&] { ++calls; });
  EXPECT_FALSE(progress->isCancelled());
  progress->cancel();
  progress->cancel();
  EXPECT_TRUE(progress->isCancelled());
  EXPECT_EQ(calls, 1);
}

TEST(ProgressTest, CallsAHandlerThatComesTooLateAtOnce) {
  const auto progress = NSProgress::progressWithTotalUnitCount(0);
  progress->cancel();
  int calls = 0;
  progress->setCancellationHandler([&] { ++calls; });
  EXPECT_EQ(calls, 1);
  progress->setCancellationHandler(nullptr);
}

TEST(ProgressTest, LetsGoOfTheHandlerAfterTheCall) {
  const auto progress = NSProgress::progressWithTotalUnitCount(0);
  auto held = std::make_shared<int>();
  const std::weak_ptr<int> weak = held;
  progress->setCancellationHandler([held = std::move(held)] {});
  EXPECT_FALSE(weak.expired());
  progress->cancel();
  EXPECT_TRUE(weak.expired());
}

TEST(ProgressTest, CancelsItsChildrenAlsoThoseThatComeLater) {
  const auto parent = NSProgress::progressWithTotalUnitCount(2);
  const auto early = NSProgress::progressWithTotalUnitCount(1);
  const auto late = NSProgress::progressWithTotalUnitCount(1);
  parent->addChild(early, 1);
  parent->cancel();
  EXPECT_TRUE(early->isCancelled());
  parent->addChild(late, 1);
  EXPECT_TRUE(late->isCancelled());
}

TEST(ProgressTest, IsCancellableUnlessSaidOtherwise) {
  const auto progress = NSProgress::progressWithTotalUnitCount(0);
  EXPECT_TRUE(progress->isCancellable());
  progress->setCancellable(false);
  EXPECT_FALSE(progress->isCancellable());
}

TEST(ProgressTest, CallsTheHandlerOnceWhoeverCancels) {
  for (int round = 0; round < 100; ++round) {
    const auto progress = NSProgress::progressWithTotalUnitCount(0);
    std::atomic<int> calls{0};
    std::vector<std::thread> threads;
    threads.emplace_back([&] { progress->setCancellationHandler([&] { ++calls; }); });
    for (int i = 0; i < 2; ++i) threads.emplace_back([&] { progress->cancel(); });
    for (auto& thread : threads) thread.join();
    EXPECT_EQ(calls, 1);
  }
}

}  // namespace
}  // namespace yomber
