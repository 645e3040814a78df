#include "platform/foundation/serial_queue.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <functional>
#include <stdexcept>
#include <thread>
#include <vector>

#include "platform/foundation/gate.h"

namespace yomber {
namespace {

class SerialQueueTest : public testing::Test {
 protected:
  std::shared_ptr<SerialQueue> queue_ = SerialQueue::create("test");
};

TEST_F(SerialQueueTest, RunsItemsInTheOrderOfSubmission) {
  std::vector<int> order;
  for (int i = 0; i < 1000; ++i) queue_->async([&order, i] { order.push_back(i); });
  queue_->sync([&] { order.push_back(1000); });
  ASSERT_EQ(order.size(), 1001U);
  for (int i = 0; i <= 1000; ++i) EXPECT_EQ(order[static_cast<std::size_t>(i)], i);
}

TEST_F(SerialQueueTest, RunsSyncOnTheCallingThreadWhenItIsIdle) {
  std::thread::id ran;
  queue_->sync([&] { ran = std::this_thread::get_id(); });
  EXPECT_EQ(ran, std::this_thread::get_id());
}

TEST_F(SerialQueueTest, RunsAsyncNeverOnTheCallersStack) {
  std::thread::id ran;
  Gate done;
  queue_->async([&] {
    ran = std::this_thread::get_id();
    done.open();
  });
  ASSERT_TRUE(done.wait());
  EXPECT_NE(ran, std::this_thread::get_id());
}

TEST_F(SerialQueueTest, RunsAnItemThatAnItemSubmitsAfterIt) {
  std::string order;
  Gate done;
  queue_->async([&] {
    queue_->async([&] {
      order += "b";
      done.open();
    });
    order += "a";
  });
  ASSERT_TRUE(done.wait());
  EXPECT_EQ(order, "ab");
}

TEST_F(SerialQueueTest, KeepsSyncAndAsyncInOneLine) {
  Gate blocked;
  Gate release;
  std::vector<int> order;
  queue_->async([&] {
    blocked.open();
    EXPECT_TRUE(release.wait());
  });
  ASSERT_TRUE(blocked.wait());
  queue_->async([&] { order.push_back(1); });
  std::thread waiting([&] { queue_->sync([&] { order.push_back(2); }); });
  std::thread releasing([&] { release.open(); });
  waiting.join();
  releasing.join();
  queue_->async([&] { order.push_back(3); });
  queue_->sync([&] { order.push_back(4); });
  EXPECT_EQ(order, (std::vector<int>{1, 2, 3, 4}));
}

TEST_F(SerialQueueTest, NeverRunsTwoItemsAtATime) {
  std::int64_t unguarded = 0;  // the queue is its only lock
  std::vector<std::thread> threads;
  for (int t = 0; t < 8; ++t) {
    threads.emplace_back([&] {
      for (int i = 0; i < 2000; ++i) {
        if (i % 3 == 0) {
          queue_->async([&] { ++unguarded; });
        } else {
          queue_->sync([&] { ++unguarded; });
        }
      }
    });
  }
  for (auto& thread : threads) thread.join();
  std::int64_t result = 0;
  queue_->sync([&] { result = unguarded; });
  EXPECT_EQ(result, 8 * 2000);
}

TEST_F(SerialQueueTest, RunsWhatWasSubmittedWhenItsLastReferenceGoes) {
  Gate first;
  Gate release;
  Gate done;
  queue_->async([&] {
    first.open();
    EXPECT_TRUE(release.wait());
  });
  queue_->async([&] { done.open(); });
  ASSERT_TRUE(first.wait());
  queue_.reset();
  release.open();
  EXPECT_TRUE(done.wait());
}

TEST_F(SerialQueueTest, KnowsWhetherTheThreadIsOnIt) {
  const auto other = SerialQueue::create("other");
  EXPECT_FALSE(queue_->isCurrent());
  queue_->sync([&] {
    EXPECT_TRUE(queue_->isCurrent());
    queue_->assertOnQueue();
    EXPECT_FALSE(other->isCurrent());
    other->sync([&] {
      EXPECT_TRUE(queue_->isCurrent());
      EXPECT_TRUE(other->isCurrent());
    });
    EXPECT_FALSE(other->isCurrent());
  });
  EXPECT_FALSE(queue_->isCurrent());
  Gate done;
  queue_->async([&] {
    EXPECT_TRUE(queue_->isCurrent());
    done.open();
  });
  EXPECT_TRUE(done.wait());
}

TEST_F(SerialQueueTest, IsFreeAgainAfterASyncThatThrows) {
  EXPECT_THROW(queue_->sync([] { throw std::runtime_error("x"); }), std::runtime_error);
  EXPECT_FALSE(queue_->isCurrent());
  bool ran = false;
  queue_->sync([&] { ran = true; });
  EXPECT_TRUE(ran);
}

TEST_F(SerialQueueTest, LetsManyQueuesWaitForEachOther) {
  // A chain of items that block on the next queue needs a thread for each of them.
  constexpr std::size_t kDepth = 100;
  std::vector<std::shared_ptr<SerialQueue>> queues;
  for (std::size_t i = 0; i < kDepth; ++i) queues.push_back(SerialQueue::create("chain"));
  std::function<void(std::size_t)> descend = [&](std::size_t level) {
    if (level == kDepth) return;
    Gate next;
    queues[level]->async([&] {
      descend(level + 1);
      next.open();
    });
    EXPECT_TRUE(next.wait());
  };
  descend(0);
}

TEST_F(SerialQueueTest, TellsItsLabel) { EXPECT_EQ(queue_->label(), "test"); }

using SerialQueueDeathTest = SerialQueueTest;

TEST_F(SerialQueueDeathTest, AbortsOnASyncFromItsOwnItem) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(queue_->sync([&] { queue_->sync([] {}); }), "queue \"test\": sync was called");
}

TEST_F(SerialQueueDeathTest, AbortsWhenCodeIsNotOnTheQueue) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(queue_->assertOnQueue(), "queue \"test\": this code must run on the queue");
}

}  // namespace
}  // namespace yomber
