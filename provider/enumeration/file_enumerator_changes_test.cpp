// The change history: collecting, handing out, dropping.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <thread>

#include "provider/enumeration/change_tokens.h"
#include "provider/testing/file_enumerator_fixture.h"
#include "provider/testing/gate.h"

namespace yomber {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::SizeIs;

constexpr const char* kInvalidating = "[DEBUG] invalidating change token";
constexpr const char* kSignalling = "[DEBUG] signal changes to fileproviderd";
/// How long a thread that must not get on is watched.
constexpr auto kWatchfulness = std::chrono::milliseconds(50);

std::vector<ItemFields> documents(std::uint64_t first, std::uint64_t last) {
  std::vector<ItemFields> result;
  for (std::uint64_t id = first; id <= last; ++id) result.push_back(scriptedDocument(id, "item"));
  return result;
}

class ChangeHistoryTest : public FileEnumeratorFixture {
 protected:
  void expectExpired(const std::shared_ptr<RecordingChangeObserver>& observer) {
    EXPECT_THAT(observer->calls(), ElementsAre("error"));
    EXPECT_EQ(domainAndCode(observer->error()), "NSFileProviderErrorDomain -1002");
    EXPECT_TRUE(observer->error()->userInfo().empty());
  }

  const NSFileProviderSyncAnchor first = currentAnchor(enumerator);
};

// ---- Collecting --------------------------------------------------------------------------------

TEST_F(ChangeHistoryTest, AnUpdateFollowedByADeletionInOneBatchLeavesOnlyTheDeletion) {
  const auto item = scriptedDocument(5, "five");
  EXPECT_TRUE(receive({item, dead(item)}));
  const auto observer = changesFrom(first);
  EXPECT_THAT(observer->updated(), IsEmpty());
  EXPECT_THAT(observer->deleted(), ElementsAre("d:5"));
}

TEST_F(ChangeHistoryTest, ADeletionFollowedByAnUpdateLeavesOnlyTheUpdate) {
  const auto item = scriptedDocument(5, "five");
  EXPECT_TRUE(receive({dead(item), item}));
  const auto observer = changesFrom(first);
  EXPECT_THAT(observer->updated(), ElementsAre("d:5"));
  EXPECT_THAT(observer->deleted(), IsEmpty());
}

TEST_F(ChangeHistoryTest, TwoDeletionsOfAnItemLeaveItsIdentifierTwice) {
  const auto item = scriptedDocument(5, "five");
  receive({dead(item)});
  receive({dead(item)});
  EXPECT_THAT(changesFrom(first)->deleted(), ElementsAre("d:5", "d:5"));
}

TEST_F(ChangeHistoryTest, AnUpdateAfterTwoDeletionsRemovesBothAndLeavesOthersInTheirOrder) {
  const auto item = scriptedDocument(5, "five");
  receive(
      {dead(scriptedFolder(9, "nine")), dead(item), dead(scriptedDocument(4, "four")), dead(item)});
  receive({item});
  const auto observer = changesFrom(first);
  EXPECT_THAT(observer->deleted(), ElementsAre("i:9", "d:4"));
  EXPECT_THAT(observer->updated(), ElementsAre("d:5"));
}

TEST_F(ChangeHistoryTest, ALaterUpdateOfAnItemReplacesTheEarlierOne) {
  struct NameTaker : RecordingChangeObserver {
    void didUpdateItems(const NSFileProviderItems& items) override {
      for (const auto& item : items) names.push_back(item->filename());
    }
    std::vector<std::string> names;
  };
  receive({scriptedDocument(5, "old name"), scriptedDocument(5, "new name")});
  auto observer = std::make_shared<NameTaker>();
  enumerator->enumerateChangesForObserver(observer, first);
  EXPECT_THAT(observer->names, ElementsAre("new name"));
}

TEST_F(ChangeHistoryTest, ABatchIsSignalledForTheContainerAndThenAnswered) {
  std::vector<std::size_t> signalsWhenAnswered;
  enumerator->receiveUpdates({}, {}, {},
                             [&] { signalsWhenAnswered.push_back(manager.signals().size()); });
  EXPECT_THAT(signalsWhenAnswered, ElementsAre(1U));
  EXPECT_THAT(manager.signals(), ElementsAre("i:3"));
  EXPECT_EQ(log.count(LogLevel::Debug, kSignalling), 1U);
}

TEST_F(ChangeHistoryTest, ABatchWithoutAReplyIsTakenToo) {
  const auto item = std::make_shared<const QSQueryItem>(scriptedDocument(5, "five"));
  enumerator->receiveUpdates({item}, {}, {}, nullptr);
  EXPECT_THAT(changesFrom(first)->updated(), ElementsAre("d:5"));
}

TEST_F(ChangeHistoryTest, TheRootsOwnRecordHasNoIdentifierAndIsPassedOver) {
  ItemFields root = scriptedFolder(0, "");
  root.identifier = NSFileProviderRootContainerItemIdentifier;
  EXPECT_TRUE(receive({root, dead(root), scriptedDocument(5, "five")}));
  const auto observer = changesFrom(first);
  EXPECT_THAT(observer->updated(), ElementsAre("d:5"));
  EXPECT_THAT(observer->deleted(), IsEmpty());
}

TEST_F(ChangeHistoryTest, AFailedSignalIsOnlyLoggedAndCallsEveryContainerTheRoot) {
  const auto error = NSError::errorWithDomain("SignalDomain", 9);
  manager.setAnswer(error);
  EXPECT_TRUE(receive({scriptedDocument(5, "five")}));
  EXPECT_TRUE(log.waitFor(
      LogLevel::Error,
      "[ERROR] failed to signal enumerator for root container: " + error->description()));
  EXPECT_THAT(manager.signals(), SizeIs(1));
  EXPECT_THAT(changesFrom(first)->updated(), ElementsAre("d:5"));
}

TEST_F(ChangeHistoryTest, AProgressUpdateDoesNothingAndIsNeverAnswered) {
  bool answered = false;
  enumerator->receiveProgressUpdates({"d:5"}, [&] { answered = true; });
  EXPECT_FALSE(answered);
  EXPECT_THAT(manager.signals(), IsEmpty());
  EXPECT_THAT(changesFrom(first)->calls(), ElementsAre("anchor"));
}

// ---- The limit ---------------------------------------------------------------------------------

TEST_F(ChangeHistoryTest, FiveThousandPendingEntriesKeepTheHistory) {
  EXPECT_TRUE(receive(documents(1, 5000)));
  EXPECT_EQ(log.count(LogLevel::Debug, kInvalidating), 0U);
  EXPECT_THAT(changesFrom(first)->updated(), SizeIs(5000));
}

TEST_F(ChangeHistoryTest, TheBatchThatBringsFiveThousandAndOneDropsTheHistoryAndIsStillSignalled) {
  EXPECT_TRUE(receive(documents(1, 5000)));
  EXPECT_TRUE(receive({dead(scriptedDocument(6000, "gone"))}));
  EXPECT_EQ(log.count(LogLevel::Debug, kInvalidating), 1U);
  EXPECT_THAT(manager.signals(), ElementsAre("i:3", "i:3"));
  EXPECT_FALSE(currentAnchor(enumerator)->isEqualToData(first));
  EXPECT_THAT(changesFrom(currentAnchor(enumerator))->calls(), ElementsAre("anchor"));
  expectExpired(changesFrom(first));
}

TEST_F(ChangeHistoryTest, TheLimitCountsWhatIsLeftAfterTheBatchNotItsRecords) {
  std::vector<ItemFields> batch;
  for (int i = 0; i < 6000; ++i) batch.push_back(scriptedDocument(5, "five"));
  EXPECT_TRUE(receive(batch));
  EXPECT_EQ(log.count(LogLevel::Debug, kInvalidating), 0U);
  EXPECT_THAT(changesFrom(first)->updated(), ElementsAre("d:5"));
}

TEST_F(ChangeHistoryTest, TheLimitCountsRepeatedDeletions) {
  const auto item = dead(scriptedDocument(5, "five"));
  EXPECT_TRUE(receive(std::vector<ItemFields>(5000, item)));
  EXPECT_EQ(log.count(LogLevel::Debug, kInvalidating), 0U);
  EXPECT_TRUE(receive({item}));
  EXPECT_EQ(log.count(LogLevel::Debug, kInvalidating), 1U);
}

// ---- Handing out -------------------------------------------------------------------------------

TEST_F(ChangeHistoryTest, AFreshAnchorWithoutChangesIsAnsweredWithItself) {
  log.forget();
  const auto observer = changesFrom(first);
  EXPECT_THAT(observer->calls(), ElementsAre("anchor"));
  EXPECT_EQ(observer->anchor(), first);
  EXPECT_FALSE(observer->moreComing());
  EXPECT_THAT(log.texts(), ElementsAre("[DEBUG] ┏# listing changes", "[DEBUG] requested rank: 0",
                                       "[DEBUG] no update to send back", "[DEBUG] ┗# "));
}

TEST_F(ChangeHistoryTest, ABatchIsHandedOutOnceWithTheNextRankAndBothCallsAreMade) {
  receive({scriptedDocument(5, "five"), scriptedDocument(6, "six")});
  const auto observer = changesFrom(first);
  EXPECT_THAT(observer->calls(), ElementsAre("updates", "deletions", "anchor"));
  EXPECT_THAT(observer->updated(), ElementsAre("d:5", "d:6"));
  EXPECT_THAT(observer->deleted(), IsEmpty());
  EXPECT_EQ(rankOf(observer->anchor()), 1U);
  EXPECT_EQ(observer->anchor()->bytes().substr(8), first->bytes().substr(8));
  EXPECT_FALSE(observer->moreComing());

  const auto again = changesFrom(observer->anchor());
  EXPECT_THAT(again->calls(), ElementsAre("anchor"));
  receive({dead(scriptedDocument(5, "five"))});
  const auto second = changesFrom(again->anchor());
  EXPECT_THAT(second->calls(), ElementsAre("updates", "deletions", "anchor"));
  EXPECT_THAT(second->deleted(), ElementsAre("d:5"));
  EXPECT_EQ(rankOf(second->anchor()), 2U);
}

TEST_F(ChangeHistoryTest, AfterABatchTheRankZeroAnchorIsExpiredAndTheHistoryIsDropped) {
  receive({scriptedDocument(5, "five")});
  const auto delivered = changesFrom(first);
  receive({scriptedDocument(6, "six")});
  log.forget();
  expectExpired(changesFrom(first));
  EXPECT_THAT(log.texts(),
              ElementsAre("[DEBUG] ┏# listing changes", "[DEBUG] requested rank: 0",
                          "[DEBUG] token expired (current rank 1)", kInvalidating, "[DEBUG] ┗# "));
  // The history is gone with all that was pending.
  expectExpired(changesFrom(delivered->anchor()));
  EXPECT_THAT(changesFrom(currentAnchor(enumerator))->calls(), ElementsAre("anchor"));
}

TEST_F(ChangeHistoryTest, AnExpiredAnchorIsFinishedBeforeTheHistoryIsDropped) {
  auto observer = std::make_shared<RecordingChangeObserver>();
  observer->whileCalled = [&](const std::string& call) {
    EXPECT_EQ(call, "error");
    EXPECT_TRUE(currentAnchor(enumerator)->isEqualToData(first));
  };
  enumerator->enumerateChangesForObserver(observer, NSData::dataWithString("foreign"));
  expectExpired(observer);
  EXPECT_FALSE(currentAnchor(enumerator)->isEqualToData(first));
}

TEST_F(ChangeHistoryTest, AnExpiredAnchorIsNotSignalled) {
  expectExpired(changesFrom(currentAnchor(makeEnumerator())));
  EXPECT_THAT(manager.signals(), IsEmpty());
}

TEST_F(ChangeHistoryTest, AnAnchorOfAnEarlierGenerationReadsMinusOneAndIsExpired) {
  expectExpired(changesFrom(currentAnchor(makeEnumerator())));
  EXPECT_EQ(log.count(LogLevel::Debug, "[DEBUG] requested rank: -1"), 1U);
  EXPECT_FALSE(currentAnchor(enumerator)->isEqualToData(first));
  expectExpired(changesFrom(first));
}

TEST_F(ChangeHistoryTest, AnAnchorThatWasNeverGivenIsExpired) {
  UUID uuid{};
  std::memcpy(uuid.data(), first->bytes().data() + 8, uuid.size());
  expectExpired(changesFrom(qs_changeTokenFromRank(5, uuid)));
  expectExpired(changesFrom(NSData::dataWithString("malformed")));
  expectExpired(changesFrom(NSData::dataWithString("")));
}

// ---- The lock ----------------------------------------------------------------------------------

TEST_F(ChangeHistoryTest, AnExpiredAnchorIsFinishedWithTheLockHeld) {
  Gate received;
  std::thread receiver;
  auto observer = std::make_shared<RecordingChangeObserver>();
  observer->whileCalled = [&](const std::string& call) {
    EXPECT_EQ(call, "error");
    receiver =
        std::thread([&] { enumerator->receiveUpdates({}, {}, {}, [&] { received.open(); }); });
    EXPECT_FALSE(received.wait(kWatchfulness));
  };
  enumerator->enumerateChangesForObserver(observer, NSData::dataWithString("foreign"));
  EXPECT_TRUE(received.wait());
  receiver.join();
}

TEST_F(ChangeHistoryTest, TheCurrentAnchorIsGivenWhileAnotherThreadHoldsTheLock) {
  Gate given;
  std::thread asker;
  auto observer = std::make_shared<RecordingChangeObserver>();
  observer->whileCalled = [&](const std::string& call) {
    EXPECT_EQ(call, "error");
    asker = std::thread([&] {
      EXPECT_NE(currentAnchor(enumerator), nullptr);
      given.open();
    });
    EXPECT_TRUE(given.wait());
  };
  enumerator->enumerateChangesForObserver(observer, NSData::dataWithString("foreign"));
  expectExpired(observer);
  asker.join();
}

TEST_F(ChangeHistoryTest, NoUpdateIsFinishedWithTheLockHeld) {
  Gate received;
  std::thread receiver;
  auto observer = std::make_shared<RecordingChangeObserver>();
  observer->whileCalled = [&](const std::string& call) {
    EXPECT_EQ(call, "anchor");
    receiver =
        std::thread([&] { enumerator->receiveUpdates({}, {}, {}, [&] { received.open(); }); });
    EXPECT_FALSE(received.wait(kWatchfulness));
  };
  enumerator->enumerateChangesForObserver(observer, first);
  EXPECT_TRUE(received.wait());
  receiver.join();
}

TEST_F(ChangeHistoryTest, ChangesAreHandedOutAfterTheLockWasReleased) {
  receive({scriptedDocument(5, "five")});
  auto observer = std::make_shared<RecordingChangeObserver>();
  observer->whileCalled = [&](const std::string&) {
    Gate received;
    std::thread receiver([&] { enumerator->receiveUpdates({}, {}, {}, [&] { received.open(); }); });
    EXPECT_TRUE(received.wait());
    receiver.join();
  };
  enumerator->enumerateChangesForObserver(observer, first);
  EXPECT_THAT(observer->calls(), ElementsAre("updates", "deletions", "anchor"));
}

TEST_F(ChangeHistoryTest, TheLockMayBeTakenAgainByTheObserverThatIsCalledUnderIt) {
  auto observer = std::make_shared<RecordingChangeObserver>();
  observer->whileCalled = [&](const std::string&) { receive({scriptedDocument(5, "five")}); };
  enumerator->enumerateChangesForObserver(observer, first);
  EXPECT_THAT(changesFrom(first)->updated(), ElementsAre("d:5"));
}

TEST_F(ChangeHistoryTest, ABatchIsSignalledAndAnsweredAfterTheLockWasReleased) {
  Gate finished;
  std::thread other;
  enumerator->receiveUpdates({}, {}, {}, [&] {
    other = std::thread([&] {
      (void)changesFrom(first);
      finished.open();
    });
    EXPECT_TRUE(finished.wait());
  });
  other.join();
}

TEST_F(ChangeHistoryTest, ReceivingHandingOutAndDroppingRunConcurrently) {
  std::vector<std::thread> threads;
  for (std::uint64_t thread = 0; thread < 2; ++thread) {
    threads.emplace_back([&, thread] {
      for (std::uint64_t id = 1; id <= 200; ++id) {
        EXPECT_TRUE(receive({scriptedDocument(thread * 1000 + id, "item")}));
      }
    });
  }
  threads.emplace_back([&] {
    for (int i = 0; i < 200; ++i) {
      NSFileProviderSyncAnchor anchor = currentAnchor(enumerator);
      while (true) {
        const auto observer = changesFrom(anchor);
        if (observer->error() != nullptr || observer->updated().empty()) break;
        anchor = observer->anchor();
      }
    }
  });
  threads.emplace_back([&] {
    for (int i = 0; i < 50; ++i) enumerator->containerListDidChange();
  });
  for (auto& thread : threads) thread.join();

  enumerator->containerListDidChange();
  receive({scriptedDocument(7, "seven")});
  EXPECT_THAT(changesFrom(currentAnchor(enumerator))->updated(), ElementsAre("d:7"));
}

}  // namespace
}  // namespace yomber
