#include "platform/foundation/notification_center.h"

#include <gtest/gtest.h>

#include <thread>
#include <vector>

namespace yomber {
namespace {

class NotificationCenterTest : public testing::Test {
 protected:
  NSNotificationCenter center_;
  std::shared_ptr<int> observer_ = std::make_shared<int>();
};

TEST_F(NotificationCenterTest, CallsWhoRegisteredForTheNameInOrder) {
  std::string calls;
  center_.addObserver(observer_, "a", [&] { calls += "1"; });
  center_.addObserver(std::make_shared<int>(), "a", [&] { calls += "gone"; });
  center_.addObserver(observer_, "b", [&] { calls += "b"; });
  center_.addObserver(observer_, "a", [&] { calls += "2"; });
  center_.postNotificationName("a");
  EXPECT_EQ(calls, "12");
  center_.postNotificationName("nobody");
  EXPECT_EQ(calls, "12");
}

TEST_F(NotificationCenterTest, DoesNotKeepObserversAlive) {
  int calls = 0;
  center_.addObserver(observer_, "a", [&] { ++calls; });
  observer_.reset();
  center_.postNotificationName("a");
  EXPECT_EQ(calls, 0);
}

TEST_F(NotificationCenterTest, KeepsTheObserverWhileItsHandlerRuns) {
  const std::weak_ptr<int> weak = observer_;
  bool alive = false;
  center_.addObserver(observer_, "a", [&] {
    observer_.reset();
    alive = !weak.expired();
  });
  center_.postNotificationName("a");
  EXPECT_TRUE(alive);
  EXPECT_TRUE(weak.expired());
}

TEST_F(NotificationCenterTest, RemovesAnObserverForOneNameOrForAll) {
  std::string calls;
  const auto other = std::make_shared<int>();
  for (const char* name : {"a", "b", "c"}) {
    center_.addObserver(observer_, name, [&calls, name] { calls += name; });
  }
  center_.addObserver(other, "b", [&] { calls += "other"; });
  center_.removeObserver(observer_.get(), "a");
  for (const char* name : {"a", "b", "c"}) center_.postNotificationName(name);
  EXPECT_EQ(calls, "botherc");
  calls.clear();
  center_.removeObserver(observer_.get());
  for (const char* name : {"a", "b", "c"}) center_.postNotificationName(name);
  EXPECT_EQ(calls, "other");
}

TEST_F(NotificationCenterTest, LetsAHandlerAddAndRemoveObservers) {
  int added = 0;
  center_.addObserver(observer_, "a", [&] {
    center_.removeObserver(observer_.get());
    center_.addObserver(observer_, "a", [&] { ++added; });
  });
  center_.postNotificationName("a");
  EXPECT_EQ(added, 0) << "a post reaches only who was there when it began";
  center_.postNotificationName("a");
  EXPECT_EQ(added, 1);
}

TEST_F(NotificationCenterTest, MayBeUsedByManyThreads) {
  std::atomic<int> calls{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&] {
      for (int i = 0; i < 200; ++i) {
        const auto mine = std::make_shared<int>();
        center_.addObserver(mine, "a", [&] { ++calls; });
        center_.postNotificationName("a");
        if (i % 2 == 0) center_.removeObserver(mine.get());
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_GE(calls, 800);
  calls = 0;
  center_.postNotificationName("a");
  EXPECT_EQ(calls, 0);
}

}  // namespace
}  // namespace yomber
