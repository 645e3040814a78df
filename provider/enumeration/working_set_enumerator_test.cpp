#include "provider/enumeration/working_set_enumerator.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "platform/ostrell/errors.h"
#include "provider/testing/provider_fixture.h"

namespace yomber {
namespace {

using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

using Call = ScriptedDaemon::Call;
using Changes = ScriptedDaemon::Changes;

class WorkingSetEnumeratorTest : public ProviderTest {
 protected:
  void answerRankWith(const NSErrorRef& error) {
    daemon.script([&error](ScriptedDaemon::Answers& answers) {
      answers.currentNotifRank = [error] {
        return ScriptedDaemon::Rank{.rank = 5, .error = error};
      };
    });
  }
  void answerChangesWith(const Changes& changes) {
    daemon.script([&changes](ScriptedDaemon::Answers& answers) {
      answers.enumerateWorkingSetChanges = [changes](const std::optional<std::string>&,
                                                     std::uint32_t) { return changes; };
    });
  }
  std::shared_ptr<RecordingEnumerationObserver> list() {
    auto observer = std::make_shared<RecordingEnumerationObserver>();
    enumerator->enumerateItemsForObserver(observer, NSFileProviderInitialPageSortedByDate);
    EXPECT_TRUE(observer->waitUntilFinished());
    return observer;
  }
  std::shared_ptr<RecordingChangeObserver> changesFrom(const NSFileProviderSyncAnchor& anchor) {
    auto observer = std::make_shared<RecordingChangeObserver>();
    enumerator->enumerateChangesForObserver(observer, anchor);
    EXPECT_TRUE(observer->waitUntilFinished());
    return observer;
  }

  std::shared_ptr<QSWorkingSetEnumerator> enumerator = std::make_shared<QSWorkingSetEnumerator>();
};

TEST_F(WorkingSetEnumeratorTest, TheInitialAnchorIsSeventeenBytesWithoutATerminator) {
  EXPECT_EQ(QSWorkingSetEnumerator::initialSyncAnchor()->bytes(), "initialSyncAnchor");
  EXPECT_EQ(QSWorkingSetEnumerator::initialSyncAnchor()->length(), 17U);
}

TEST_F(WorkingSetEnumeratorTest, TheCurrentAnchorIsAlwaysTheInitialOneAndGivenAtOnce) {
  std::vector<std::string> anchors;
  const auto take = [&](const NSFileProviderSyncAnchor& anchor) {
    anchors.emplace_back(anchor->bytes());
  };
  enumerator->currentSyncAnchorWithCompletionHandler(take);
  answerChangesWith({.updated = {}, .deleted = {}, .token = "later", .error = nullptr});
  (void)changesFrom(QSWorkingSetEnumerator::initialSyncAnchor());
  enumerator->currentSyncAnchorWithCompletionHandler(take);
  enumerator->currentSyncAnchorWithCompletionHandler(nullptr);
  EXPECT_THAT(anchors, ElementsAre("initialSyncAnchor", "initialSyncAnchor"));
}

TEST_F(WorkingSetEnumeratorTest, TheListingIsEmptyAndThenSignalsTheWorkingSet) {
  answerRankWith(nullptr);
  const auto observer = list();
  ASSERT_TRUE(manager.waitForSignals(1));
  EXPECT_THAT(observer->calls(), ElementsAre("page"));
  EXPECT_EQ(observer->nextPage(), nullptr);
  EXPECT_THAT(manager.signals(), ElementsAre(NSFileProviderWorkingSetContainerItemIdentifier));
}

TEST_F(WorkingSetEnumeratorTest, AFailedSignalOfTheWorkingSetIsNotLogged) {
  answerRankWith(nullptr);
  manager.setAnswer(NSError::errorWithDomain("SignalDomain", 9));
  (void)list();
  ASSERT_TRUE(manager.waitForSignals(1));
  EXPECT_EQ(log.countContaining("failed to signal"), 0U);
}

TEST_F(WorkingSetEnumeratorTest, AListingWhileSignedOutIsBareNotAuthenticatedAndSignalsNothing) {
  answerRankWith(qsc_errorLoggedOut());
  const auto observer = list();
  EXPECT_THAT(observer->calls(), ElementsAre("error"));
  EXPECT_EQ(domainAndCode(observer->error()), "NSFileProviderErrorDomain -1000");
  EXPECT_TRUE(observer->error()->userInfo().empty());
  EXPECT_THAT(manager.signals(), IsEmpty());
}

TEST_F(WorkingSetEnumeratorTest, OtherListingErrorsAreTranslated) {
  answerRankWith(NSError::errorWithDomain(NSCocoaErrorDomain, 4354));
  EXPECT_EQ(domainAndCode(list()->error()), "NSFileProviderErrorDomain -1003");
  answerRankWith(NSError::errorWithDomain(QSOstrellErrorDomain, 5));
  EXPECT_EQ(domainAndCode(list()->error()), "QSOstrellErrorDomain 5");
}

TEST_F(WorkingSetEnumeratorTest, AConnectionLostWhileListingIsGivenRaw) {
  daemon.hold("currentNotifRank");
  auto observer = std::make_shared<RecordingEnumerationObserver>();
  enumerator->enumerateItemsForObserver(observer, nullptr);
  ASSERT_TRUE(daemon.waitForCalls("currentNotifRank"));
  daemon.dropConnections();
  ASSERT_TRUE(observer->waitUntilFinished());
  EXPECT_THAT(observer->calls(), ElementsAre("error"));
  EXPECT_NE(observer->error()->domain(), NSFileProviderErrorDomain);
}

TEST_F(WorkingSetEnumeratorTest, AConnectionLostWhileAskingForChangesIsGivenRaw) {
  daemon.hold("enumerateWorkingSetChanges");
  auto observer = std::make_shared<RecordingChangeObserver>();
  enumerator->enumerateChangesForObserver(observer, QSWorkingSetEnumerator::initialSyncAnchor());
  ASSERT_TRUE(daemon.waitForCalls("enumerateWorkingSetChanges"));
  daemon.dropConnections();
  ASSERT_TRUE(observer->waitUntilFinished());
  EXPECT_THAT(observer->calls(), ElementsAre("error"));
  EXPECT_NE(observer->error()->domain(), NSFileProviderErrorDomain);
}

TEST_F(WorkingSetEnumeratorTest, TheInitialAnchorIsSentToTheDaemonAsNil) {
  std::optional<std::optional<std::string>> asked;
  daemon.script([&](ScriptedDaemon::Answers& answers) {
    answers.enumerateWorkingSetChanges = [&](const std::optional<std::string>& token,
                                             std::uint32_t limit) {
      asked = token;
      EXPECT_EQ(limit, 200U);
      return Changes{.updated = {}, .deleted = {}, .token = "later", .error = nullptr};
    };
  });
  const auto observer = changesFrom(NSData::dataWithString("initialSyncAnchor"));
  ASSERT_TRUE(asked.has_value());
  EXPECT_EQ(*asked, std::nullopt);
  EXPECT_EQ(observer->anchor()->bytes(), "later");
  EXPECT_TRUE(observer->moreComing());
}

TEST_F(WorkingSetEnumeratorTest, AnyOtherAnchorIsRelayedAsItIs) {
  const std::string anchor("bytes\0of the daemon", 19);
  answerChangesWith({.updated = {}, .deleted = {}, .token = anchor, .error = nullptr});
  (void)changesFrom(NSData::dataWithString(anchor));
  EXPECT_THAT(daemon.calls(), Contains(Call{"enumerateWorkingSetChanges", {anchor, "200"}}));
}

TEST_F(WorkingSetEnumeratorTest, TheAnchorThatWasAskedForMeansNoMoreComing) {
  answerChangesWith(
      {.updated = {scriptedDocument(5, "five")}, .deleted = {}, .token = "same", .error = nullptr});
  const auto observer = changesFrom(NSData::dataWithString("same"));
  EXPECT_THAT(observer->calls(), ElementsAre("updates", "deletions", "anchor"));
  EXPECT_THAT(observer->updated(), ElementsAre("d:5"));
  EXPECT_EQ(observer->anchor()->bytes(), "same");
  EXPECT_FALSE(observer->moreComing());
}

TEST_F(WorkingSetEnumeratorTest, AnotherAnchorMeansMoreComingAlsoWhenTheBatchIsEmpty) {
  answerChangesWith({.updated = {}, .deleted = {}, .token = "next", .error = nullptr});
  const auto observer = changesFrom(NSData::dataWithString("same"));
  EXPECT_THAT(observer->calls(), ElementsAre("updates", "deletions", "anchor"));
  EXPECT_THAT(observer->updated(), IsEmpty());
  EXPECT_THAT(observer->deleted(), IsEmpty());
  EXPECT_TRUE(observer->moreComing());
}

TEST_F(WorkingSetEnumeratorTest, DeletedItemsAreReportedByIdentifier) {
  const auto folder = std::make_shared<const QSFileObjectID>(QSFileObjectID::Kind::Folder, 8);
  const auto document = std::make_shared<const QSFileObjectID>(QSFileObjectID::Kind::Document, 7);
  answerChangesWith(
      {.updated = {}, .deleted = {document, folder}, .token = "next", .error = nullptr});
  EXPECT_THAT(changesFrom(NSData::dataWithString("same"))->deleted(), ElementsAre("d:7", "i:8"));
}

TEST_F(WorkingSetEnumeratorTest, ChangesWhileSignedOutAreBareNotAuthenticated) {
  answerChangesWith({.updated = {}, .deleted = {}, .token = {}, .error = qsc_errorLoggedOut()});
  const auto observer = changesFrom(QSWorkingSetEnumerator::initialSyncAnchor());
  EXPECT_THAT(observer->calls(), ElementsAre("error"));
  EXPECT_EQ(domainAndCode(observer->error()), "NSFileProviderErrorDomain -1000");
  EXPECT_TRUE(observer->error()->userInfo().empty());
}

TEST_F(WorkingSetEnumeratorTest, OtherChangeErrorsAreTranslated) {
  answerChangesWith({.updated = {},
                     .deleted = {},
                     .token = {},
                     .error = NSError::errorWithDomain(NSCocoaErrorDomain, 4355)});
  EXPECT_EQ(domainAndCode(changesFrom(nullptr)->error()), "NSFileProviderErrorDomain -1004");
  answerChangesWith({.updated = {},
                     .deleted = {},
                     .token = {},
                     .error = NSError::errorWithDomain(NSFileProviderErrorDomain, -1002)});
  EXPECT_EQ(domainAndCode(changesFrom(NSData::dataWithString("old"))->error()),
            "NSFileProviderErrorDomain -1002");
}

TEST_F(WorkingSetEnumeratorTest, RepliesAfterInvalidationStillFinishTheirObservers) {
  answerChangesWith({.updated = {}, .deleted = {}, .token = "next", .error = nullptr});
  answerRankWith(nullptr);
  daemon.hold("*");
  auto listing = std::make_shared<RecordingEnumerationObserver>();
  auto changes = std::make_shared<RecordingChangeObserver>();
  enumerator->enumerateItemsForObserver(listing, nullptr);
  enumerator->enumerateChangesForObserver(changes, nullptr);
  enumerator->invalidate();
  enumerator.reset();
  daemon.release("*");
  EXPECT_TRUE(listing->waitUntilFinished());
  EXPECT_TRUE(changes->waitUntilFinished());
}

}  // namespace
}  // namespace yomber
