#include "platform/foundation/thread_pool.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <fstream>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "platform/foundation/gate.h"
#include "platform/foundation/log.h"
#include "platform/foundation/sanitized.h"

namespace yomber {
namespace {

using namespace std::chrono_literals;

/// Waits, on the clock and without sleeping long, until `holds`.
template <typename Condition>
bool eventually(const Condition& holds) {
  const auto deadline = std::chrono::steady_clock::now() + 30s;
  while (!holds()) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    std::this_thread::yield();
  }
  return true;
}

TEST(ThreadPoolTest, RunsEverythingBeforeItEnds) {
  std::atomic<int> count{0};
  {
    ThreadPool pool({});
    for (int i = 0; i < 1000; ++i) pool.async([&] { ++count; });
  }
  EXPECT_EQ(count, 1000);
}

TEST(ThreadPoolTest, StartsWorkInOrderOnASingleThread) {
  std::vector<int> order;
  {
    ThreadPool pool({.promptThreads = 1, .maximumThreads = 1});
    for (int i = 0; i < 100; ++i) pool.async([&order, i] { order.push_back(i); });
  }
  ASSERT_EQ(order.size(), 100U);
  EXPECT_TRUE(std::is_sorted(order.begin(), order.end()));
}

TEST(ThreadPoolTest, GrowsWhileItsThreadsBlock) {
  constexpr int kBlocked = 200;
  Gate arrived;
  Gate released;
  ThreadPool pool({.promptThreads = 2});
  for (int i = 0; i < kBlocked; ++i) {
    pool.async([&] {
      arrived.open();
      EXPECT_TRUE(released.wait());
    });
  }
  EXPECT_TRUE(arrived.wait(kBlocked)) << "all of them must run at a time";
  EXPECT_EQ(pool.threadCount(), static_cast<std::size_t>(kBlocked));
  released.open();
}

TEST(ThreadPoolTest, DoesNotGrowForShortWork) {
  ThreadPool pool({.promptThreads = 2, .stallTime = 10s});
  Gate done;
  for (int i = 0; i < 10'000; ++i) pool.async([&] { done.open(); });
  EXPECT_TRUE(done.wait(10'000));
  EXPECT_LE(pool.threadCount(), 2U);
}

TEST(ThreadPoolTest, LetsIdleThreadsEndDownToTheNumberKept) {
  constexpr int kBlocked = 20;
  Gate arrived;
  Gate released;
  ThreadPool pool({.promptThreads = kBlocked, .keptIdleThreads = 3, .idleTime = 20ms});
  for (int i = 0; i < kBlocked; ++i) {
    pool.async([&] {
      arrived.open();
      EXPECT_TRUE(released.wait());
    });
  }
  ASSERT_TRUE(arrived.wait(kBlocked));
  released.open();
  EXPECT_TRUE(eventually([&] { return pool.threadCount() <= 3; }));
  Gate again;
  pool.async([&] { again.open(); });
  EXPECT_TRUE(again.wait());
}

/// In MiB.
double residentMemory() {
  std::size_t size = 0;
  std::size_t resident = 0;
  std::ifstream("/proc/self/statm") >> size >> resident;
  return static_cast<double>(resident) * static_cast<double>(sysconf(_SC_PAGESIZE)) / (1 << 20);
}

TEST(ThreadPoolTest, GivesMemoryBackWhenABurstIsOver) {
  if (kIsSanitized) GTEST_SKIP() << "a sanitizer's heap keeps what was freed";
  constexpr int kBlocked = 8;
  constexpr std::size_t kBlocks = 8'192;
  std::array<std::vector<std::unique_ptr<std::string>>, kBlocked> blocks;
  Gate arrived;
  Gate released;
  ThreadPool pool({.promptThreads = kBlocked, .keptIdleThreads = 2, .idleTime = 20ms});
  for (auto& own : blocks) {
    pool.async([&] {
      for (std::size_t i = 0; i < kBlocks; ++i)
        own.push_back(std::make_unique<std::string>(1'000, 'x'));
      arrived.open();
      EXPECT_TRUE(released.wait());
      // What is left is at the end of the heap, and keeps it from shrinking by itself.
      own.erase(own.begin(), own.end() - 1);
    });
  }
  ASSERT_TRUE(arrived.wait(kBlocked));
  const double full = residentMemory();
  released.open();
  constexpr double kFreed = 1'000.0 * kBlocks * kBlocked / (1 << 20);
  EXPECT_TRUE(eventually([&] { return residentMemory() < full - kFreed / 2; }))
      << residentMemory() << " of " << full;
}

TEST(ThreadPoolTest, StopsAtItsHardBoundSaysSoAndGoesOnWhenAThreadIsFree) {
  struct BoundSink final : Log::Sink {
    void write(LogLevel level, std::string_view line) override {
      if (level == LogLevel::Fault && line.find("all 3 threads") != line.npos) said.open();
    }
    Gate said;
  };
  const auto sink = std::make_shared<BoundSink>();
  defaultLog().setSink(sink);
  Gate released;
  Gate done;
  {
    ThreadPool pool({.promptThreads = 1, .maximumThreads = 3});
    for (int i = 0; i < 10; ++i) {
      pool.async([&] {
        EXPECT_TRUE(released.wait());
        done.open();
      });
    }
    EXPECT_TRUE(sink->said.wait());
    EXPECT_EQ(pool.threadCount(), 3U);
    released.open();
    EXPECT_TRUE(done.wait(10));
  }
  defaultLog().setSink(nullptr);
}

TEST(ThreadPoolTest, LetsGoOfWorkAsSoonAsItRan) {
  ThreadPool pool({});
  auto held = std::make_shared<int>();
  const std::weak_ptr<int> weak = held;
  pool.async([held = std::move(held)] {});
  EXPECT_TRUE(eventually([&] { return weak.expired(); }));
}

}  // namespace
}  // namespace yomber
