#include "zarn/content/share_rows.h"

#include <gtest/gtest.h>

#include <functional>
#include <memory>
#include <set>

#include "platform/foundation/temporary_directory.h"
#include "zarn/database.h"
#include "zarn/write_transaction.h"

namespace yomber {
namespace {

using IDs = std::vector<std::uint64_t>;

constexpr std::uint64_t kRoot = 7000;
constexpr std::int64_t kSecond = 1'000'000'000;

class WaitingRecordsTest : public testing::Test {
 protected:
  void SetUp() override {
    NSErrorRef error;
    database_ = Database::open(directory_.path() + "/zarn.db", &error);
    ASSERT_NE(database_, nullptr) << error->description();
    ShareRow share;
    share.root = kRoot;
    share.account = 1;
    share.zone = RZRecordZoneID("share-7000");
    change([&](Connection& connection) { storeShare(connection, share); });
  }
  void change(const std::function<void(Connection&)>& work) {
    ASSERT_EQ(database_->write([&](WriteTransaction& transaction) {
      work(transaction.connection());
      return NSErrorRef();
    }),
              nullptr);
  }
  void postpone(std::uint64_t record, std::int64_t now) {
    change([&](Connection& connection) { postponeWaitingRecord(connection, kRoot, record, now); });
  }
  [[nodiscard]] IDs due(std::int64_t now, std::size_t limit = 100) const {
    IDs found;
    EXPECT_EQ(database_->read([&](Connection& connection) {
      found = findWaitingRecords(connection, kRoot, now, limit);
    }),
              nullptr);
    return found;
  }
  /// How long the record that was postponed at `now` is not asked for, in seconds.
  [[nodiscard]] std::int64_t pauseAfter(std::int64_t now) const {
    constexpr std::int64_t kDay = 86'400;
    for (std::int64_t seconds = 0; seconds < kDay; ++seconds) {
      if (!due(now + seconds * kSecond).empty()) return seconds;
    }
    return kDay;
  }

 private:
  TemporaryDirectory directory_;
  std::shared_ptr<Database> database_;
};

TEST_F(WaitingRecordsTest, WhatCannotBePlacedIsAskedForLaterAndLaterAndAtLastNoMore) {
  std::int64_t now = 0;
  for (const std::int64_t expected :
       {3, 6, 12, 24, 48, 96, 192, 384, 768, 1536, 3072, 3600, 86'400, 86'400}) {
    postpone(7001, now);
    EXPECT_EQ(pauseAfter(now), expected);
    now += expected * kSecond;
  }
  change([](Connection& connection) {
    EXPECT_TRUE(hasWaitingRecords(connection, kRoot)) << "it is not forgotten";
    EXPECT_TRUE(hasPostponedRecords(connection, 1));
    EXPECT_FALSE(hasPostponedRecords(connection, 2));
    makeAllWaitingRecordsDue(connection, 2);
  });
  EXPECT_EQ(due(now), IDs{}) << "another account";
  change([](Connection& connection) { makeAllWaitingRecordsDue(connection, 1); });
  EXPECT_EQ(due(now), IDs{7001}) << "somebody asks for it";
}

TEST_F(WaitingRecordsTest, WhoseFolderHasComeIsAskedForAtOnce) {
  postpone(7001, 0);
  change([](Connection& connection) { makeWaitingRecordsDue(connection, kRoot + 1); });
  EXPECT_EQ(due(0), IDs{});
  change([](Connection& connection) { makeWaitingRecordsDue(connection, kRoot); });
  EXPECT_EQ(due(0), IDs{7001});
}

TEST_F(WaitingRecordsTest, ThoseThatHaveWaitedLongestComeFirst) {
  for (const std::uint64_t record : {7003U, 7001U, 7002U}) {
    postpone(record, static_cast<std::int64_t>(record) * kSecond);
  }
  const std::int64_t later = 8000 * kSecond;
  EXPECT_EQ(due(later), (IDs{7001, 7002, 7003}));
  EXPECT_EQ(due(later, 1), IDs{7001});
  postpone(7001, later);
  EXPECT_EQ(due(later, 1), IDs{7002}) << "the others get their turn";
}

TEST_F(WaitingRecordsTest, ManyThatStayDueKeepNoneFromItsTurn) {
  change([](Connection& connection) {
    for (std::uint64_t record = 7001; record < 7041; ++record)
      addWaitingRecord(connection, kRoot, record);
  });
  std::set<std::uint64_t> seen;
  for (int pass = 0; pass < 1000 && seen.size() < 40; ++pass) {
    for (const std::uint64_t record : due(0, 4)) seen.insert(record);
  }
  EXPECT_EQ(seen.size(), 40U);
}

}  // namespace
}  // namespace yomber
