#include "zarn/tree_journal.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <chrono>
#include <thread>
#include <utility>

#include "zarn/recording_receiver.h"
#include "zarn/test_drive.h"
#include "zarn/write_transaction.h"

namespace yomber::test {
namespace {

using testing::Contains;
using testing::ElementsAre;
using testing::IsEmpty;
using testing::Pair;

constexpr const char* kComposed = "caf\u00e9";
constexpr const char* kDecomposed = "cafe\u0301";

/// A tree whose folders nobody watches, unless a test says so.
class TreeJournalTest : public TestDrive {
 protected:
  void begin(TreeJournal::Options options = {}) {
    scan();
    journal_ = std::make_shared<TreeJournal>(
        store, [this](std::uint64_t) { return areWatched_; }, options);
    database->addSink(journal_);
  }
  void observe() {
    subscription_ = journal_->subscribe(receiver_);
    ASSERT_TRUE(receiver_->waitForCalls({"start"}));
  }
  [[nodiscard]] std::uint64_t inode(const std::string& path) const {
    return inodeOfLocation(at(path));
  }
  [[nodiscard]] static std::uint64_t inodeOfLocation(const std::string& path) {
    struct stat status{};
    EXPECT_EQ(lstat(path.c_str(), &status), 0) << path;
    return status.st_ino;
  }
  [[nodiscard]] DiskEntry entry(const std::string& folder, const std::string& name) const {
    return {.folder = inode(folder), .name = name};
  }

  /// Whether nobody but the test keeps the receiver; it is dropped.
  [[nodiscard]] bool waitUntilLetGoOf() {
    const std::weak_ptr<RecordingReceiver> watched = std::exchange(receiver_, nullptr);
    // The thread that has just told it may still be on its way out.
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(20);
    while (!watched.expired() && std::chrono::steady_clock::now() < deadline) {
      std::this_thread::yield();
    }
    return watched.expired();
  }

  bool areWatched_ = false;
  std::shared_ptr<TreeJournal> journal_;
  std::shared_ptr<RecordingReceiver> receiver_ = std::make_shared<RecordingReceiver>();
  std::shared_ptr<JournalSubscription> subscription_;
};

TEST_F(TreeJournalTest, WhatAScanFindsIsToldByFolderAndNameOnDisk) {
  makeFolder("a");
  write("a/goes");
  write("a/changes");
  begin();
  observe();
  write("a/comes");
  write("a/changes", "other text");
  const DiskEntry gone = entry("a", "goes");
  remove("a/goes");
  ASSERT_EQ(scanFolders({"a"}), nullptr);
  EXPECT_TRUE(receiver_->waitForEntry(entry("a", "comes")));
  EXPECT_TRUE(receiver_->waitForEntry(entry("a", "changes")));
  EXPECT_TRUE(receiver_->waitForEntry(gone));
}

TEST_F(TreeJournalTest, AMoveIsToldAtBothPlaces) {
  makeFolder("a");
  makeFolder("b");
  write("a/x");
  begin();
  observe();
  rename("a/x", "b/y");
  ASSERT_EQ(scanFolders({"a", "b"}), nullptr);
  EXPECT_TRUE(receiver_->waitForEntry(entry("a", "x")));
  EXPECT_TRUE(receiver_->waitForEntry(entry("b", "y")));
}

TEST_F(TreeJournalTest, ChangesThatAreShownOfNoItemAreToldToo) {
  write("x");
  begin();
  observe();
  setAttribute("x", "user.of-somebody", "1");
  ASSERT_EQ(scanFolders({""}), nullptr);
  EXPECT_TRUE(receiver_->waitForEntry(entry("", "x")));
}

TEST_F(TreeJournalTest, TheEntriesOfWatchedFoldersAreLeftToTheirEvents) {
  write("x");
  write(kComposed);
  begin();
  observe();
  areWatched_ = true;
  write("x", "changed");
  write(kDecomposed);
  ASSERT_EQ(scanFolders({""}), nullptr);
  EXPECT_TRUE(receiver_->waitFor([](const auto& told) { return !told.names.empty(); }));
  EXPECT_THAT(receiver_->told().entries, IsEmpty());
  journal_->entriesDidChange({entry("", "x")});
  EXPECT_TRUE(receiver_->waitForEntry(entry("", "x")));
}

TEST_F(TreeJournalTest, AFolderThatIsGoneIsToldAsAWholeInTheFewestWords) {
  makeFolder("a");
  for (int i = 0; i < 20; ++i) write("a/" + std::to_string(i));
  begin();
  observe();
  const DiskEntry whole = entry("a", "");
  remove("a");
  ASSERT_EQ(scanFolders({""}), nullptr);
  EXPECT_TRUE(receiver_->waitForEntry(entry("", "a")));
  EXPECT_TRUE(receiver_->waitForEntry(whole));
  for (const auto& each : receiver_->told().entries) {
    EXPECT_TRUE(each.folder != whole.folder || each.name.empty()) << each.name;
  }
}

TEST_F(TreeJournalTest, NamesThatDifferFromTheDiskComeAtTheStartAndWhenTheyChange) {
  makeFolder("a");
  write("a/" + std::string(kComposed));
  begin();
  write("a/" + std::string(kDecomposed));
  ASSERT_EQ(scanFolders({"a"}), nullptr);
  observe();
  const auto key = std::pair(inode("a"), std::string(kDecomposed));
  const std::string bounced = std::string(kDecomposed) + " 2";
  EXPECT_THAT(receiver_->told().names, ElementsAre(Pair(key, bounced)));
  // The one that had the name goes; the other keeps its own until it is renamed.
  rename("a/" + std::string(kDecomposed), "a/plain");
  ASSERT_EQ(scanFolders({"a"}), nullptr);
  EXPECT_TRUE(receiver_->waitFor([](const auto& told) { return told.names.empty(); }));
  rename("a/plain", "a/" + std::string(kDecomposed));
  ASSERT_EQ(scanFolders({"a"}), nullptr);
  EXPECT_TRUE(receiver_->waitFor([&](const auto& told) { return told.names.contains(key); }));
  remove("a/" + std::string(kDecomposed));
  ASSERT_EQ(scanFolders({"a"}), nullptr);
  EXPECT_TRUE(receiver_->waitFor([](const auto& told) { return told.names.empty(); }));
}

TEST_F(TreeJournalTest, ANameThatOneItemGaveUpAndAnotherTookIsTheOthers) {
  makeFolder("a");
  makeFolder("b");
  for (const char* folder : {"a/", "b/"}) write(folder + std::string(kComposed));
  begin();
  for (const char* folder : {"a/", "b/"}) write(folder + std::string(kDecomposed));
  ASSERT_EQ(scanFolders({"a", "b"}), nullptr);
  observe();
  ASSERT_EQ(receiver_->told().names.size(), 2U);
  rename("a/" + std::string(kDecomposed), "a/away");
  rename("b/" + std::string(kDecomposed), "a/" + std::string(kDecomposed));
  ASSERT_EQ(scanFolders({"a", "b"}), nullptr);
  const auto key = std::pair(inode("a"), std::string(kDecomposed));
  EXPECT_TRUE(receiver_->waitFor([](const auto& told) { return told.names.size() == 1; }));
  EXPECT_THAT(receiver_->told().names, ElementsAre(Pair(key, std::string(kDecomposed) + " 2")));
}

TEST_F(TreeJournalTest, OfAnItemThatChangedTwiceInOneCommitOnlyTheLastNameHolds) {
  write("x");
  begin();
  observe();
  const auto before = row("x");
  ASSERT_EQ(database->write([&](WriteTransaction& transaction) -> NSErrorRef {
    ItemRow between = *before;
    between.diskName = "between";
    (void)transaction.update(*before, between);
    ItemRow after = between;
    after.diskName = "after";
    (void)transaction.update(between, after);
    return nullptr;
  }),
            nullptr);
  EXPECT_TRUE(receiver_->waitForEntry(entry("", "after")));
  EXPECT_TRUE(receiver_->waitForEntry(entry("", "between")));
  EXPECT_TRUE(receiver_->waitForEntry(entry("", "x")));
  EXPECT_THAT(receiver_->told().names, ElementsAre(Pair(Pair(inode(""), "after"), "x")));
}

TEST_F(TreeJournalTest, ContainersAreToldByTheirLocations) {
  begin();
  ASSERT_EQ(store->setContainers({{"org.example.Notes", "Notes"}}), nullptr);
  observe();
  const std::string notes = layout.documents("org.example.Notes");
  const std::string other = layout.documents("org.example.Other");
  EXPECT_THAT(receiver_->told().containers, ElementsAre(Pair(notes, "Notes")));
  ASSERT_EQ(store->setContainers({{"org.example.Other", "Other"}}), nullptr);
  EXPECT_TRUE(receiver_->waitFor([&](const auto& told) {
    return told.containers == std::map<std::string, std::string>{{other, "Other"}};
  }));
  EXPECT_THAT(receiver_->told().entries, Contains(DiskEntry{inodeOfLocation(notes), ""}));
}

TEST_F(TreeJournalTest, AFolderInThePlaceOfAnotherTakesItsNamesWithIt) {
  makeFolder("a");
  write("a/" + std::string(kComposed));
  begin();
  write("a/" + std::string(kDecomposed));
  ASSERT_EQ(scanFolders({"a"}), nullptr);
  observe();
  const auto before = row("a");
  ASSERT_EQ(database->write([&](WriteTransaction& transaction) -> NSErrorRef {
    ItemRow after = *before;
    after.inode = before->inode + 1;
    (void)transaction.update(*before, after);
    return nullptr;
  }),
            nullptr);
  EXPECT_TRUE(receiver_->waitForCalls({"start", "lost", "start"}));
  EXPECT_THAT(receiver_->told().names,
              ElementsAre(Pair(Pair(before->inode + 1, kDecomposed), testing::_)));
}

TEST_F(TreeJournalTest, ManyNamesComeInPartsOfBoundedSize) {
  makeFolder("a");
  std::map<std::pair<std::uint64_t, std::string>, std::string> expected;
  begin({.maximumWaiting = 4, .maximumBatch = 3, .namesAtStart = 2});
  for (int i = 0; i < 9; ++i) {
    const std::string folder = i % 2 == 0 ? "a/" : "";
    const std::string number = std::to_string(i);
    write(folder + kComposed + number);
    ASSERT_EQ(scanFolders({"", "a"}), nullptr);
    write(folder + kDecomposed + number);
    expected[{inode(folder), kDecomposed + number}] = kDecomposed + number + " 2";
  }
  ASSERT_EQ(scanFolders({"", "a"}), nullptr);
  subscription_ = journal_->subscribe(receiver_);
  EXPECT_TRUE(receiver_->waitForCalls({"start", "change", "change", "change"}));
  EXPECT_EQ(receiver_->told().names, expected);
}

TEST_F(TreeJournalTest, AReceiverThatDoesNotAnswerHoldsUpNobodyAndIsToldWhatWasGathered) {
  makeFolder("a");
  begin();
  receiver_->hold();
  subscription_ = journal_->subscribe(receiver_);
  ASSERT_TRUE(receiver_->waitForCalls({"start"}));
  const auto other = std::make_shared<RecordingReceiver>();
  const auto second = journal_->subscribe(other);
  ASSERT_TRUE(other->waitForCalls({"start"}));
  for (int round = 0; round < 3; ++round) {
    write("a/x", std::string(round + 10, 'x'));
    ASSERT_EQ(scanFolders({"a"}), nullptr);
  }
  EXPECT_TRUE(other->waitForEntry(entry("a", "x")));
  EXPECT_THAT(receiver_->told().calls, ElementsAre("start"));
  receiver_->release();
  EXPECT_TRUE(receiver_->waitForEntry(entry("a", "x")));
  EXPECT_THAT(receiver_->told().calls, ElementsAre("start", "change"));
}

TEST_F(TreeJournalTest, TooMuchThatWaitsIsDroppedAndTheReceiverStartsAnew) {
  begin({.maximumWaiting = 10});
  receiver_->hold();
  subscription_ = journal_->subscribe(receiver_);
  ASSERT_TRUE(receiver_->waitForCalls({"start"}));
  for (int i = 0; i < 11; ++i) journal_->entriesDidChange({{1, std::to_string(i)}});
  ASSERT_TRUE(receiver_->answer());
  ASSERT_TRUE(receiver_->waitForCalls({"start", "lost"}));
  EXPECT_THAT(receiver_->told().entries, IsEmpty());
  // What comes after that call was made is not covered by it.
  journal_->entriesDidChange({{1, "later"}});
  receiver_->release();
  EXPECT_TRUE(receiver_->waitForCalls({"start", "lost", "start", "change"}));
  EXPECT_THAT(receiver_->told().entries, ElementsAre(DiskEntry{1, "later"}));
}

TEST_F(TreeJournalTest, AsMuchAsMayWaitIsTold) {
  begin({.maximumWaiting = 10, .maximumBatch = 4});
  receiver_->hold();
  subscription_ = journal_->subscribe(receiver_);
  ASSERT_TRUE(receiver_->waitForCalls({"start"}));
  for (int i = 0; i < 10; ++i) journal_->entriesDidChange({{1, std::to_string(i)}});
  receiver_->release();
  EXPECT_TRUE(receiver_->waitForCalls({"start", "change", "change", "change"}));
  EXPECT_EQ(receiver_->told().entries.size(), 10U);
}

TEST_F(TreeJournalTest, EvenWhenTrackIsLostBeforeItTheFirstCallIsAStart) {
  begin();
  receiver_->hold();
  subscription_ = journal_->subscribe(receiver_);
  journal_->didLoseTrack();
  receiver_->release();
  EXPECT_TRUE(receiver_->waitForCalls({"start", "lost", "start"}));
}

TEST_F(TreeJournalTest, WhoDoesNotTakeACallIsToldNothingMore) {
  begin();
  receiver_->hold();
  subscription_ = journal_->subscribe(receiver_);
  ASSERT_TRUE(receiver_->waitForCalls({"start"}));
  ASSERT_TRUE(receiver_->answer(false));
  EXPECT_EQ(journal_->count(), 0U);
  journal_->entriesDidChange({{1, "x"}});
  journal_->didLoseTrack();
  EXPECT_THAT(receiver_->told().calls, ElementsAre("start"));
  // And let go of, although he still has his subscription.
  EXPECT_TRUE(waitUntilLetGoOf());
}

TEST_F(TreeJournalTest, ADroppedSubscriptionLeavesNothingBehind) {
  begin();
  EXPECT_FALSE(journal_->wantsEvents());
  observe();
  EXPECT_TRUE(journal_->wantsEvents());
  subscription_.reset();
  EXPECT_TRUE(waitUntilLetGoOf());
  EXPECT_EQ(journal_->count(), 0U);
  EXPECT_FALSE(journal_->wantsEvents());
}

}  // namespace
}  // namespace yomber::test
