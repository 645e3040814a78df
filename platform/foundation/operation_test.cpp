#include "platform/foundation/operation.h"

#include <gtest/gtest.h>

#include <atomic>
#include <mutex>
#include <string>

#include "platform/foundation/gate.h"

namespace yomber {
namespace {

/// Runs a function; an asynchronous one stays unfinished until `complete`.
class TestOperation final : public NSOperation {
 public:
  enum class Kind { Synchronous, Asynchronous };

  explicit TestOperation(std::function<void()> work = {}, Kind kind = Kind::Synchronous)
      : work_(std::move(work)), kind_(kind) {}

  [[nodiscard]] bool isAsynchronous() const override { return kind_ == Kind::Asynchronous; }
  void complete() { finish(); }

 protected:
  void main() override {
    if (work_) work_();
  }

 private:
  const std::function<void()> work_;
  const Kind kind_;
};

using Kind = TestOperation::Kind;

TEST(OperationTest, RunsOnceAndIsFinished) {
  int runs = 0;
  int completions = 0;
  const auto operation = std::make_shared<TestOperation>([&] { ++runs; });
  operation->setCompletionBlock([&] { ++completions; });
  EXPECT_FALSE(operation->isFinished());
  operation->start();
  operation->start();
  EXPECT_EQ(runs, 1);
  EXPECT_EQ(completions, 1);
  EXPECT_TRUE(operation->isFinished());
  EXPECT_FALSE(operation->isExecuting());
}

TEST(OperationTest, StaysExecutingUntilAnAsynchronousOneFinishes) {
  const auto operation = std::make_shared<TestOperation>(nullptr, Kind::Asynchronous);
  int completions = 0;
  operation->setCompletionBlock([&] { ++completions; });
  operation->start();
  EXPECT_TRUE(operation->isExecuting());
  EXPECT_EQ(completions, 0);
  operation->complete();
  operation->complete();
  EXPECT_TRUE(operation->isFinished());
  EXPECT_EQ(completions, 1);
}

TEST(OperationTest, FinishesWithoutRunningWhenItWasCancelledBefore) {
  int runs = 0;
  int completions = 0;
  const auto operation = std::make_shared<TestOperation>([&] { ++runs; }, Kind::Asynchronous);
  operation->setCompletionBlock([&] { ++completions; });
  operation->cancel();
  EXPECT_TRUE(operation->isCancelled());
  EXPECT_FALSE(operation->isFinished());
  operation->start();
  EXPECT_EQ(runs, 0);
  EXPECT_EQ(completions, 1);
  EXPECT_TRUE(operation->isFinished());
}

TEST(OperationTest, DescribesItselfByItsClass) {
  EXPECT_NE(TestOperation().description().find("TestOperation: 0x"), std::string::npos);
}

class OperationQueueTest : public testing::Test {
 protected:
  /// An operation that notes its name when it runs.
  std::shared_ptr<TestOperation> noting(const std::string& name) {
    return std::make_shared<TestOperation>([this, name] {
      const std::lock_guard guard(mutex_);
      order_ += name;
    });
  }
  std::string order() {
    const std::lock_guard guard(mutex_);
    return order_;
  }

  NSOperationQueue queue_;

 private:
  std::mutex mutex_;
  std::string order_;
};

TEST_F(OperationQueueTest, RunsAllOfThem) {
  std::atomic<int> count{0};
  for (int i = 0; i < 500; ++i) queue_.addOperationWithBlock([&] { ++count; });
  queue_.waitUntilAllOperationsAreFinished();
  EXPECT_EQ(count, 500);
  EXPECT_TRUE(queue_.operations().empty());
}

TEST_F(OperationQueueTest, RunsAsManyAtATimeAsThereAre) {
  constexpr int kCount = 60;
  Gate arrived;
  Gate release;
  for (int i = 0; i < kCount; ++i) {
    queue_.addOperationWithBlock([&] {
      arrived.open();
      EXPECT_TRUE(release.wait());
    });
  }
  EXPECT_TRUE(arrived.wait(kCount));
  release.open();
  queue_.waitUntilAllOperationsAreFinished();
}

TEST_F(OperationQueueTest, KeepsToItsMaximumAlsoForAsynchronousOnes) {
  queue_.setMaxConcurrentOperationCount(1);
  Gate started;
  const auto first = std::make_shared<TestOperation>([&] { started.open(); }, Kind::Asynchronous);
  const auto second = noting("b");
  queue_.addOperation(first);
  queue_.addOperation(second);
  ASSERT_TRUE(started.wait());
  EXPECT_TRUE(first->isExecuting());
  EXPECT_FALSE(second->isExecuting());
  EXPECT_EQ(queue_.operations().size(), 2U);
  first->complete();
  second->waitUntilFinished();
  EXPECT_EQ(order(), "b");
}

TEST_F(OperationQueueTest, StartsInTheOrderOfAddingWhenOneRunsAtATime) {
  queue_.setMaxConcurrentOperationCount(1);
  for (const char* name : {"a", "b", "c", "d", "e"}) queue_.addOperation(noting(name));
  queue_.waitUntilAllOperationsAreFinished();
  EXPECT_EQ(order(), "abcde");
}

TEST_F(OperationQueueTest, WaitsForDependencies) {
  const auto a = noting("a");
  const auto b = noting("b");
  const auto c = noting("c");
  NSOperationQueue other;
  b->addDependency(a);
  c->addDependency(a);
  c->addDependency(b);
  queue_.addOperation(c);
  other.addOperation(b);
  EXPECT_FALSE(b->isExecuting() || c->isExecuting());
  queue_.addOperation(a);
  queue_.waitUntilAllOperationsAreFinished();
  EXPECT_EQ(order(), "abc");
  EXPECT_TRUE(c->dependencies().empty()) << "finished ones must not keep chains alive";
}

TEST_F(OperationQueueTest, AcceptsADependencyThatIsFinishedAlready) {
  const auto a = noting("a");
  a->start();
  const auto b = noting("b");
  b->addDependency(a);
  queue_.addOperation(b);
  queue_.waitUntilAllOperationsAreFinished();
  EXPECT_EQ(order(), "ab");
}

TEST_F(OperationQueueTest, StartsNothingWhileItIsSuspended) {
  queue_.setSuspended(true);
  EXPECT_TRUE(queue_.isSuspended());
  const auto a = noting("a");
  queue_.addOperation(a);
  EXPECT_FALSE(a->isExecuting() || a->isFinished());
  queue_.setSuspended(false);
  queue_.waitUntilAllOperationsAreFinished();
  EXPECT_EQ(order(), "a");
}

TEST_F(OperationQueueTest, CancelsWhatWaitsAndLetsItFinish) {
  queue_.setSuspended(true);
  std::atomic<int> completions{0};
  for (const char* name : {"a", "b"}) {
    const auto operation = noting(name);
    operation->setCompletionBlock([&] { ++completions; });
    queue_.addOperation(operation);
  }
  queue_.cancelAllOperations();
  queue_.setSuspended(false);
  queue_.waitUntilAllOperationsAreFinished();
  EXPECT_EQ(order(), "");
  EXPECT_EQ(completions, 2);
}

TEST_F(OperationQueueTest, CountsAnOperationThatSomebodyElseStarted) {
  queue_.setSuspended(true);
  const auto a = noting("a");
  queue_.addOperation(a);
  a->start();
  queue_.waitUntilAllOperationsAreFinished();
  queue_.setSuspended(false);
  queue_.setMaxConcurrentOperationCount(1);
  queue_.addOperation(noting("b"));
  queue_.waitUntilAllOperationsAreFinished();
  EXPECT_EQ(order(), "ab");
}

TEST_F(OperationQueueTest, RunsItsOperationsWhenTheQueueIsGone) {
  Gate done;
  {
    NSOperationQueue brief;
    brief.addOperationWithBlock([&] { done.open(); });
  }
  EXPECT_TRUE(done.wait());
}

}  // namespace
}  // namespace yomber
