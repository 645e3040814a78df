#include "zarn/watchers.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <map>
#include <string>

#include "platform/ostrell/constants.h"

namespace yomber {
namespace {

using testing::ElementsAre;
using testing::IsEmpty;

/// Notes what it is told as "+id" and "-id", a batch a string.
class FakeReceiver final : public WatchReceiver {
 public:
  void receive(std::vector<WatchedChange> changes, std::function<void(bool)> answered) override {
    std::string batch;
    for (const auto& change : changes) {
      batch += (change.isDeletion ? "-" : "+") + std::to_string(change.row->id);
      told_ += 1;
    }
    batches.push_back(std::move(batch));
    if (answersAtOnce) return answered(true);
    EXPECT_FALSE(pending) << "the last batch was not answered yet";
    pending = std::move(answered);
  }
  void fail(NSErrorRef error) override {
    EXPECT_FALSE(failure) << "failed twice";
    failure = std::move(error);
  }
  void answer(bool taken = true) { std::exchange(pending, nullptr)(taken); }
  [[nodiscard]] std::size_t told() const { return told_; }

  std::vector<std::string> batches;
  std::function<void(bool)> pending;
  NSErrorRef failure;
  bool answersAtOnce = true;

 private:
  std::size_t told_ = 0;
};

class WatchersTest : public testing::Test {
 protected:
  static constexpr std::uint32_t kDirect = WatchUpdates | WatchDeletions | WatchChildren;
  static constexpr std::uint32_t kSubtree = kDirect | WatchSubtree;

  std::shared_ptr<Watchers> make(Watchers::Options options) {
    return Watchers::create([this](std::uint64_t id) { return ancestors_[id]; }, options);
  }
  std::shared_ptr<Subscription> watch(std::uint64_t folder, std::uint32_t options) {
    auto subscription = watchers_->subscribe(receiver_);
    EXPECT_EQ(subscription->watch(folder, options), nullptr);
    return subscription;
  }
  static ItemChange made(std::uint64_t id, std::uint64_t parent) {
    ItemChange change;
    change.row.id = id;
    change.row.parent = parent;
    change.isNew = true;
    return change;
  }
  static ItemChange changed(std::uint64_t id, std::uint64_t parent) {
    return moved(id, parent, parent);
  }
  static ItemChange moved(std::uint64_t id, std::uint64_t from, std::uint64_t to) {
    ItemChange change = made(id, to);
    change.isNew = false;
    change.parentBefore = from;
    return change;
  }
  static ItemChange removed(std::uint64_t id, std::uint64_t parent) {
    ItemChange change = changed(id, parent);
    change.row.flags |= row_flag::kDead;
    return change;
  }
  static ItemChange folder(ItemChange change) {
    change.row.kind = ItemKind::Folder;
    return change;
  }

  std::map<std::uint64_t, std::vector<std::uint64_t>> ancestors_;
  std::shared_ptr<FakeReceiver> receiver_ = std::make_shared<FakeReceiver>();
  std::shared_ptr<Watchers> watchers_ = make({});
};

TEST_F(WatchersTest, AWatchOfAFolderTellsOfItsChildrenOnly) {
  const auto subscription = watch(5000, kDirect);
  watchers_->committed({made(6000, 5000), made(6001, 5001), changed(6002, 5000)});
  watchers_->committed({removed(6000, 5000), removed(6001, 5001)});
  EXPECT_THAT(receiver_->batches, ElementsAre("+6000+6002", "-6000"));
}

TEST_F(WatchersTest, AMoveIsADeletionInTheOldFolderAndAnUpdateInTheNewOne) {
  const auto from = watch(5000, kDirect);
  const auto other = std::make_shared<FakeReceiver>();
  const auto to = watchers_->subscribe(other);
  ASSERT_EQ(to->watch(5001, kDirect), nullptr);
  watchers_->committed({moved(6000, 5000, 5001)});
  EXPECT_THAT(receiver_->batches, ElementsAre("-6000"));
  EXPECT_THAT(other->batches, ElementsAre("+6000"));
}

TEST_F(WatchersTest, WhoWatchesBothFoldersOfAMoveIsToldOfTheNewPlace) {
  const auto subscription = watch(5000, kDirect);
  ASSERT_EQ(subscription->watch(5001, kDirect), nullptr);
  watchers_->committed({moved(6000, 5000, 5001)});
  watchers_->committed({moved(6000, 5001, 5000)});
  EXPECT_THAT(receiver_->batches, ElementsAre("+6000", "+6000"));
}

TEST_F(WatchersTest, TheEndOfTheWatchedFolderIsTold) {
  const auto subscription = watch(5000, kDirect);
  watchers_->committed({folder(removed(5000, kRootID)), removed(6000, 5000)});
  EXPECT_THAT(receiver_->batches, ElementsAre("-5000-6000"));
}

TEST_F(WatchersTest, OptionsChooseWhatIsTold) {
  const auto subscription = watch(5000, WatchDeletions | WatchChildren);
  watchers_->committed({made(6000, 5000)});
  watchers_->committed({removed(6000, 5000)});
  EXPECT_THAT(receiver_->batches, ElementsAre("-6000"));
  EXPECT_FALSE(areValidWatchOptions(0));
  EXPECT_FALSE(areValidWatchOptions(WatchUpdates));
  EXPECT_FALSE(areValidWatchOptions(WatchChildren));
  EXPECT_FALSE(areValidWatchOptions(kDirect | 8));
  EXPECT_TRUE(areValidWatchOptions(19));
  EXPECT_TRUE(areValidWatchOptions(23));
}

TEST_F(WatchersTest, ASubtreeWatchOfTheRootTellsOfEverythingOutsideTheTrash) {
  const auto subscription = watch(kRootID, kSubtree);
  ItemChange trashed = moved(6001, 5000, kTrashID);
  trashed.row.flags |= row_flag::kTrashed;
  watchers_->committed({made(6000, 5000), trashed, removed(6002, 5003)});
  EXPECT_THAT(receiver_->batches, ElementsAre("+6000-6001-6002"));
}

TEST_F(WatchersTest, ASubtreeWatchTellsOfWhatIsBelowItsFolder) {
  const auto subscription = watch(5000, kSubtree);
  ancestors_[5001] = {5000, kRootID};
  ancestors_[5002] = {kRootID};
  watchers_->committed({made(6000, 5001), made(6001, 5002), moved(6002, 5001, 5002),
                        moved(6003, 5002, 5001), made(6004, 5000)});
  EXPECT_THAT(receiver_->batches, ElementsAre("+6000-6002+6003+6004"));
}

TEST_F(WatchersTest, WhatFoldersHeldThatWentTogetherIsToldToo) {
  const auto subscription = watch(5000, kSubtree);
  // The database no longer knows 5001 and 5002; the commit itself says where they were.
  watchers_->committed({removed(6000, 5002), folder(removed(5002, 5001)),
                        folder(removed(5001, 5000)), removed(6001, 5003)});
  EXPECT_THAT(receiver_->batches, ElementsAre("-6000-5002-5001"));
}

TEST_F(WatchersTest, AFolderThatComesIntoASubtreeWithItsContentNeedsAFreshListing) {
  const auto subscription = watch(5000, kSubtree);
  watchers_->committed({folder(moved(6000, kRootID, 5000))});
  EXPECT_THAT(receiver_->batches, IsEmpty());
  ASSERT_TRUE(receiver_->failure);
  EXPECT_TRUE(receiver_->failure->is(QSOstrellErrorDomain, QSOstrellErrorWatcherTooSlow));
}

TEST_F(WatchersTest, OneBatchIsOnItsWayAtATimeAndTheLatestStateIsTold) {
  receiver_->answersAtOnce = false;
  const auto subscription = watch(5000, kDirect);
  watchers_->committed({made(6000, 5000)});
  watchers_->committed({changed(6000, 5000), made(6001, 5000)});
  watchers_->committed({removed(6001, 5000), made(6002, 5000)});
  watchers_->committed({changed(6000, 5000)});
  EXPECT_THAT(receiver_->batches, ElementsAre("+6000"));
  receiver_->answer();
  EXPECT_THAT(receiver_->batches, ElementsAre("+6000", "-6001+6002+6000"));
  receiver_->answer();
  EXPECT_THAT(receiver_->batches.size(), 2U);
}

TEST_F(WatchersTest, BatchesAreBounded) {
  watchers_ = make({.maximumWaiting = 100, .maximumBatch = 3});
  const auto subscription = watch(5000, kDirect);
  std::vector<ItemChange> changes;
  for (std::uint64_t i = 0; i < 7; ++i) changes.push_back(made(6000 + i, 5000));
  watchers_->committed(changes);
  EXPECT_THAT(receiver_->batches, ElementsAre("+6000+6001+6002", "+6003+6004+6005", "+6006"));
}

TEST_F(WatchersTest, AWatcherThatLeavesTooMuchWaitingIsCutOff) {
  watchers_ = make({.maximumWaiting = 10, .maximumBatch = 5});
  receiver_->answersAtOnce = false;
  const auto subscription = watch(5000, kDirect);
  watchers_->committed({made(6000, 5000)});
  for (int round = 0; round < 5; ++round) {  // the same items again and again take no more room
    for (std::uint64_t i = 0; i < 10; ++i) watchers_->committed({changed(7000 + i, 5000)});
  }
  EXPECT_FALSE(receiver_->failure);
  watchers_->committed({made(7100, 5000)});
  ASSERT_TRUE(receiver_->failure);
  EXPECT_TRUE(receiver_->failure->is(QSOstrellErrorDomain, QSOstrellErrorWatcherTooSlow));
  EXPECT_EQ(watchers_->count(), 0U);
  receiver_->answer();
  EXPECT_EQ(receiver_->batches.size(), 1U);
  EXPECT_EQ(subscription->watch(5000, kDirect), receiver_->failure);
}

TEST_F(WatchersTest, AReceiverThatDoesNotTakeItsChangesIsEnded) {
  receiver_->answersAtOnce = false;
  const auto subscription = watch(5000, kDirect);
  watchers_->committed({made(6000, 5000)});
  receiver_->answer(false);
  ASSERT_TRUE(receiver_->failure);
  EXPECT_EQ(receiver_->failure->domain(), QSOstrellErrorDomain);
  EXPECT_EQ(watchers_->count(), 0U);
}

TEST_F(WatchersTest, SignOutEndsEveryWatchWithItsError) {
  const auto subscription = watch(5000, kDirect);
  EXPECT_EQ(watchers_->count(), 1U);
  const auto error = NSError::errorWithDomain(QSOstrellErrorDomain, QSOstrellErrorLoggedOut);
  watchers_->failAll(error);
  EXPECT_EQ(receiver_->failure, error);
  watchers_->committed({made(6000, 5000)});
  EXPECT_THAT(receiver_->batches, IsEmpty());
  EXPECT_EQ(watchers_->count(), 0U);
}

TEST_F(WatchersTest, DroppingOrClosingASubscriptionEndsItsWatches) {
  auto dropped = watch(5000, kDirect);
  const auto closed = watch(5000, kDirect);
  EXPECT_EQ(watchers_->count(), 2U);
  dropped.reset();
  closed->close();
  watchers_->committed({made(6000, 5000)});
  EXPECT_THAT(receiver_->batches, IsEmpty());
  EXPECT_EQ(watchers_->count(), 0U);
  EXPECT_FALSE(receiver_->failure);
}

}  // namespace
}  // namespace yomber
