#include "mount/entry_notices.h"

#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include <gtest/gtest.h>

#include "platform/foundation/gate.h"

namespace yomber {
namespace {

/// Two folders, and a kernel that does not return from a notice about "stuck" until it is let go.
class EntryNoticesTest : public ::testing::Test {
 protected:
  void TearDown() override { pool_.reset(); }  // whoever was left behind comes back

  void send(const std::vector<std::pair<Node*, std::string>>& entries) {
    std::vector<EntryNotices::Notice> notices;
    for (const auto& [folder, name] : entries) {
      notices.push_back({.folder = nodes_.use(*folder), .name = name, .isOther = false});
    }
    notices_.send(std::move(notices));
  }
  [[nodiscard]] std::vector<std::string> told() {
    LockGuard guard(mutex_);
    return told_;
  }

  NodeTable nodes_;
  Node& one_ = nodes_.addBase(0, {});
  Node& two_ = nodes_.addBase(1, {});
  Mutex mutex_;
  std::vector<std::string> told_ GUARDED_BY(mutex_);
  Gate isStuck_;
  Gate letGo_;
  Gate arrived_;  ///< once for each that was told
  std::optional<ThreadPool> pool_{std::in_place, ThreadPool::Limits{}};
  EntryNotices notices_{[this](const EntryNotices::Notice& notice) { tell(notice.name); }, *pool_};

 private:
  void tell(const std::string& name) {
    if (name == "stuck") {
      isStuck_.open();
      EXPECT_TRUE(letGo_.wait());
    }
    {
      LockGuard guard(mutex_);
      told_.push_back(name);
    }
    arrived_.open();
  }
};

using Names = std::vector<std::string>;

TEST_F(EntryNoticesTest, AreToldInTheirOrderBeforeSendReturns) {
  send({{&one_, "a"}, {&two_, "b"}, {&one_, "c"}});
  EXPECT_EQ(told(), (Names{"a", "b", "c"}));
  send({});
  EXPECT_EQ(told().size(), 3U);
}

TEST_F(EntryNoticesTest, OfAHeldFolderAreToldWhenItIsFreeAndTheOthersAtOnce) {
  std::optional<EntryNotices::Hold> hold(std::in_place, notices_, one_, one_);
  send({{&one_, "a"}, {&two_, "b"}, {&one_, "c"}});
  EXPECT_EQ(told(), Names{"b"});
  hold.reset();
  ASSERT_TRUE(arrived_.wait(3));
  EXPECT_EQ(told(), (Names{"b", "a", "c"}));
}

TEST_F(EntryNoticesTest, OfAFolderThatTwoHoldWaitForBoth) {
  std::optional<EntryNotices::Hold> first(std::in_place, notices_, one_, two_);
  std::optional<EntryNotices::Hold> second(std::in_place, notices_, two_, two_);
  send({{&one_, "a"}, {&two_, "b"}});
  first.reset();
  ASSERT_TRUE(arrived_.wait(1));
  EXPECT_EQ(told(), Names{"a"});
  second.reset();
  ASSERT_TRUE(arrived_.wait(2));
  EXPECT_EQ(told(), (Names{"a", "b"}));
}

TEST_F(EntryNoticesTest, GoOnPastOneThatWaitsForAFolderThatWasHeldJustBefore) {
  Gate returned;
  pool_->async([&] {
    send({{&one_, "stuck"}, {&one_, "a"}, {&two_, "b"}});
    returned.open();
  });
  ASSERT_TRUE(isStuck_.wait());
  std::optional<EntryNotices::Hold> hold(std::in_place, notices_, one_, two_);
  EXPECT_TRUE(returned.wait());
  EXPECT_EQ(told(), Names{});
  letGo_.open();
  hold.reset();
  ASSERT_TRUE(arrived_.wait(3));
  EXPECT_EQ(told().size(), 3U);
}

}  // namespace
}  // namespace yomber
