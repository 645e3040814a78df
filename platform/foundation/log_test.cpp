#include "platform/foundation/log.h"

#include <gtest/gtest.h>

#include <utility>
#include <vector>

#include "platform/foundation/lock.h"

namespace yomber {
namespace {

class CollectingSink final : public Log::Sink {
 public:
  void write(LogLevel level, std::string_view line) override {
    LockGuard guard(mutex_);
    lines_.emplace_back(level, line);
  }
  std::vector<std::pair<LogLevel, std::string>> lines() {
    LockGuard guard(mutex_);
    return lines_;
  }

 private:
  Mutex mutex_;
  std::vector<std::pair<LogLevel, std::string>> lines_ GUARDED_BY(mutex_);
};

struct Counting {
  int* renderings;
  [[nodiscard]] std::string description() const {
    ++*renderings;
    return "counted";
  }
};

class LogTest : public testing::Test {
 protected:
  LogTest() { log_.setSink(sink_); }

  std::shared_ptr<CollectingSink> sink_ = std::make_shared<CollectingSink>();
  Log log_;
};

TEST_F(LogTest, WritesLinesAtAndAboveItsLevel) {
  log_.setLevel(LogLevel::Default);
  log_debug(log_, "a");
  log_info(log_, "b");
  log_default(log_, "c");
  log_error(log_, "%s", "d");
  log_fault(log_, "e");
  const std::vector<std::pair<LogLevel, std::string>> expected{
      {LogLevel::Default, "c"}, {LogLevel::Error, "d"}, {LogLevel::Fault, "e"}};
  EXPECT_EQ(sink_->lines(), expected);
}

TEST_F(LogTest, FormatsOnlyWhatItWrites) {
  int renderings = 0;
  log_.setLevel(LogLevel::Info);
  log_debug(log_, "%@", Counting{&renderings});
  EXPECT_EQ(renderings, 0);
  log_info(log_, "%@", Counting{&renderings});
  EXPECT_EQ(renderings, 1);
  EXPECT_EQ(sink_->lines().at(0).second, "counted");
}

TEST_F(LogTest, FollowsAnAttachedLevelAndGoesBackToItsOwn) {
  std::atomic<std::uint8_t> shared{static_cast<std::uint8_t>(LogLevel::Fault)};
  log_.setLevel(LogLevel::Info);
  log_.attachLevel(&shared);
  EXPECT_FALSE(log_.isEnabled(LogLevel::Error));
  shared = static_cast<std::uint8_t>(LogLevel::Debug);
  EXPECT_TRUE(log_.isEnabled(LogLevel::Debug));
  log_.attachLevel(nullptr);
  EXPECT_FALSE(log_.isEnabled(LogLevel::Debug));
  EXPECT_TRUE(log_.isEnabled(LogLevel::Info));
}

TEST(LogWithoutSinkTest, SaysErrorsOnStandardErrorAndNothingElse) {
  Log log;
  testing::internal::CaptureStderr();
  log_info(log, "quiet");
  log_error(log, "loud %d", 1);
  EXPECT_EQ(testing::internal::GetCapturedStderr(), "loud 1\n");
}

}  // namespace
}  // namespace yomber
