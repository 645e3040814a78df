#include "provider/extension/log_sections.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <cstdlib>
#include <set>
#include <stdexcept>
#include <thread>
#include <vector>

#include "provider/testing/collected_log.h"
#include "provider/testing/provider_fixture.h"

namespace yomber {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;

TEST(LogSectionAllocator, DebugThenInfoThenDebugFillTheNumbersInBetween) {
  LogSectionAllocator allocator;
  EXPECT_EQ(allocator.allocate(LogSectionLevel::Debug), 1U);
  EXPECT_EQ(allocator.allocate(LogSectionLevel::Info), 2U);
  EXPECT_EQ(allocator.allocate(LogSectionLevel::Debug), 3U);
}

TEST(LogSectionAllocator, ConsecutiveInfoSectionsSkipTheOddNumbers) {
  LogSectionAllocator allocator;
  EXPECT_EQ(allocator.allocate(LogSectionLevel::Info), 2U);
  EXPECT_EQ(allocator.allocate(LogSectionLevel::Info), 4U);
  EXPECT_EQ(allocator.allocate(LogSectionLevel::Debug), 5U);
}

TEST(LogSectionAllocator, ConsecutiveDebugSectionsSkipTheEvenNumbers) {
  LogSectionAllocator allocator;
  EXPECT_EQ(allocator.allocate(LogSectionLevel::Debug), 1U);
  EXPECT_EQ(allocator.allocate(LogSectionLevel::Debug), 3U);
  EXPECT_EQ(allocator.allocate(LogSectionLevel::Debug), 5U);
}

TEST(LogSectionAllocator, ItsQueueIsLabelledCreateLogSection) {
  EXPECT_EQ(LogSectionAllocator::processAllocator().queue().label(), "create-log-section");
}

TEST(LogSectionAllocator, AProcessStartsAtOneAndThenTwoAndThree) {
  EXPECT_IN_FRESH_PROCESS({
    EXPECT_EQ(createLogSection(LogSectionLevel::Debug), 1U);
    EXPECT_EQ(createLogSection(LogSectionLevel::Info), 2U);
    EXPECT_EQ(createLogSection(LogSectionLevel::Debug), 3U);
  });
}

TEST(LogSectionAllocator, TheFirstInfoSectionOfAProcessIsTwo) {
  EXPECT_IN_FRESH_PROCESS({ EXPECT_EQ(createLogSection(LogSectionLevel::Info), 2U); });
}

TEST(LogSectionAllocator, ConcurrentAllocationsAreUniqueIncreasingAndOfTheRightParity) {
  constexpr std::size_t kThreads = 8;
  constexpr std::size_t kEach = 2000;
  LogSectionAllocator allocator;
  std::vector<std::vector<std::uint64_t>> ids(kThreads);
  std::vector<std::thread> threads;
  for (std::size_t thread = 0; thread < kThreads; ++thread) {
    threads.emplace_back([&allocator, &mine = ids[thread], thread] {
      const auto level = thread % 2 == 0 ? LogSectionLevel::Debug : LogSectionLevel::Info;
      for (std::size_t i = 0; i < kEach; ++i) mine.push_back(allocator.allocate(level));
    });
  }
  for (auto& thread : threads) thread.join();

  std::set<std::uint64_t> all;
  for (std::size_t thread = 0; thread < kThreads; ++thread) {
    EXPECT_TRUE(std::is_sorted(ids[thread].begin(), ids[thread].end()));
    for (const std::uint64_t id : ids[thread]) {
      EXPECT_EQ(id % 2, thread % 2 == 0 ? 1U : 0U);
      all.insert(id);
    }
  }
  EXPECT_EQ(all.size(), kThreads * kEach);
  EXPECT_FALSE(all.contains(0));
  // No allocation moves the counter by more than two.
  EXPECT_LE(*all.rbegin(), 2 * kThreads * kEach);
}

TEST(LogSectionClose, ZeroWritesNothing) {
  const CollectedLog log;
  const std::uint64_t none = 0;
  closeLogSection(&none);
  EXPECT_THAT(log.lines(), IsEmpty());
}

TEST(LogSectionClose, ADebugSectionEndsInLowerCaseHexadecimalAndOneBlank) {
  const CollectedLog log;
  const std::uint64_t id = 0xabcdef;
  closeLogSection(&id);
  EXPECT_THAT(log.lines(), ElementsAre(CollectedLine{LogLevel::Debug, "[DEBUG] ┗abcdef "}));
}

TEST(LogSectionClose, AnInfoSectionEndsAtInfoLevel) {
  const CollectedLog log;
  const std::uint64_t id = 0x1c;
  closeLogSection(&id);
  EXPECT_THAT(log.lines(), ElementsAre(CollectedLine{LogLevel::Info, "[INFO] ┗1c "}));
}

TEST(LogSectionClose, NothingIsWrittenWhenTheLevelIsOff) {
  CollectedLog log;
  const std::uint64_t debug = 1;
  const std::uint64_t info = 2;
  log.setLevel(LogLevel::Info);
  closeLogSection(&debug);
  EXPECT_THAT(log.lines(), IsEmpty());
  log.setLevel(LogLevel::Default);
  closeLogSection(&info);
  EXPECT_THAT(log.lines(), IsEmpty());
}

TEST(LogSection, ClosesWhenItsScopeEnds) {
  const CollectedLog log;
  std::uint64_t id = 0;
  {
    const LogSection section(LogSectionLevel::Debug);
    id = section.id();
    EXPECT_THAT(log.lines(), IsEmpty());
  }
  EXPECT_EQ(id % 2, 1U);
  EXPECT_EQ(log.count(LogLevel::Debug, "[DEBUG] ┗# "), 1U);
  EXPECT_EQ(log.sectionOf("[DEBUG] ┗# "), id);
}

TEST(LogSection, ClosesWhenItsScopeIsLeftByAnException) {
  const CollectedLog log;
  EXPECT_THROW(
      {
        const LogSection section(LogSectionLevel::Info);
        throw std::runtime_error("left");
      },
      std::runtime_error);
  EXPECT_EQ(log.count(LogLevel::Info, "[INFO] ┗# "), 1U);
}

TEST(ErrorOutParameterLine, SaysThatTheErrorIsPassedToTheCaller) {
  const CollectedLog log;
  const auto error = NSError::errorWithDomain("SomeDomain", 7);
  NSErrorRef out;
  logErrorOutParameter("-[QSFileProviderExtension itemForIdentifier:error:]", &out, error);
  EXPECT_THAT(log.lines(),
              ElementsAre(CollectedLine{
                  LogLevel::Error,
                  "[ERROR] -[QSFileProviderExtension itemForIdentifier:error:]: (passed to caller) "
                  "error: " +
                      error->description()}));
  EXPECT_EQ(out, nullptr);
}

TEST(ErrorOutParameterLine, SaysThatTheErrorIsIgnoredByTheCaller) {
  const CollectedLog log;
  const auto error = NSError::errorWithDomain("SomeDomain", 7);
  logErrorOutParameter("-[QSFileProviderExtension itemForIdentifier:error:]", nullptr, error);
  EXPECT_THAT(log.lines(),
              ElementsAre(CollectedLine{
                  LogLevel::Error,
                  "[ERROR] -[QSFileProviderExtension itemForIdentifier:error:]: (ignored by caller)"
                  " error: " +
                      error->description()}));
}

TEST(ErrorOutParameterLine, IsNotWrittenWhenErrorsAreOff) {
  CollectedLog log;
  log.setLevel(LogLevel::Fault);
  logErrorOutParameter("-[QSFileProviderExtension itemForIdentifier:error:]", nullptr,
                       NSError::errorWithDomain("SomeDomain", 7));
  EXPECT_THAT(log.lines(), IsEmpty());
}

}  // namespace
}  // namespace yomber
