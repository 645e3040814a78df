#include "provider/enumeration/file_enumerator.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "platform/ostrell/errors.h"
#include "provider/enumeration/change_tokens.h"
#include "provider/enumeration/page_tokens.h"
#include "provider/testing/file_enumerator_fixture.h"

namespace yomber {
namespace {

using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::SizeIs;

using Call = ScriptedDaemon::Call;
using Page = ScriptedDaemon::Page;

constexpr const char* kOpen = "[DEBUG] ┏# listing items";
constexpr const char* kCalling = "[DEBUG] ┣# calling zarn";
constexpr const char* kClose = "[DEBUG] ┗# ";

class FileEnumeratorTest : public FileEnumeratorFixture {};

// ---- Creation and the current anchor -----------------------------------------------------------

TEST_F(FileEnumeratorTest, WithoutAURLThereIsNoEnumeratorAndOneErrorLine) {
  EXPECT_EQ(QSFileEnumerator::initWithFileObjectID(nullptr, nullptr, "i:5", Recursive::No),
            nullptr);
  EXPECT_EQ(log.count(LogLevel::Error, "[ERROR] can't create a file enumeration without a url"),
            1U);
  EXPECT_EQ(log.countContaining("[ERROR]"), 1U);
}

TEST_F(FileEnumeratorTest, TheCurrentAnchorOfANewEnumeratorIsRankZeroOfItsUUID) {
  const auto anchor = currentAnchor(enumerator);
  ASSERT_NE(anchor, nullptr);
  EXPECT_EQ(anchor->length(), 24U);
  EXPECT_EQ(rankOf(anchor), 0U);
  EXPECT_TRUE(currentAnchor(enumerator)->isEqualToData(anchor));
  // Every enumerator has a generation of its own.
  EXPECT_FALSE(currentAnchor(makeEnumerator())->isEqualToData(anchor));
}

TEST_F(FileEnumeratorTest, TheCurrentAnchorStaysRankZeroAfterChangesWereDelivered) {
  const auto anchor = currentAnchor(enumerator);
  receive({scriptedDocument(5, "five")});
  const auto observer = changesFrom(anchor);
  EXPECT_EQ(rankOf(observer->anchor()), 1U);
  EXPECT_TRUE(currentAnchor(enumerator)->isEqualToData(anchor));
}

TEST_F(FileEnumeratorTest, TheCurrentAnchorWithoutAHandlerDoesNothing) {
  enumerator->currentSyncAnchorWithCompletionHandler(nullptr);
  EXPECT_EQ(rankOf(currentAnchor(enumerator)), 0U);
}

// ---- Listing -----------------------------------------------------------------------------------

TEST_F(FileEnumeratorTest, ANilPageListsByNameFromTheBeginningAndLogsNoPage) {
  answerPageWith({});
  (void)list(nullptr);
  EXPECT_THAT(daemon.calls(), Contains(Call{"enumerateItemsInFolder", {"i:3", "0", "0", "200"}}));
  EXPECT_EQ(log.countContaining("from page"), 0U);
}

TEST_F(FileEnumeratorTest, TheInitialPageByDateListsByDateFromTheBeginning) {
  answerPageWith({});
  (void)list(NSFileProviderInitialPageSortedByDate);
  EXPECT_THAT(daemon.calls(), Contains(Call{"enumerateItemsInFolder", {"i:3", "1", "0", "200"}}));
  EXPECT_EQ(log.count(LogLevel::Debug, "[DEBUG] from page 0"), 1U);
}

TEST_F(FileEnumeratorTest, ALaterPageResumesAtItsOffset) {
  answerPageWith({});
  (void)list(qs_pageTokenFromSortOrder(1, 400));
  EXPECT_THAT(daemon.calls(), Contains(Call{"enumerateItemsInFolder", {"i:3", "1", "400", "200"}}));
  EXPECT_EQ(log.count(LogLevel::Debug, "[DEBUG] from page 400"), 1U);
}

TEST_F(FileEnumeratorTest, NextOffsetZeroEndsTheListingWithANilPage) {
  answerPageWith({.items = {scriptedDocument(5, "five"), scriptedFolder(6, "six")},
                  .nextOffset = 0,
                  .error = nullptr});
  const auto observer = list(nullptr);
  EXPECT_THAT(observer->calls(), ElementsAre("items", "page"));
  EXPECT_THAT(observer->identifiers(), ElementsAre("d:5", "i:6"));
  EXPECT_EQ(observer->nextPage(), nullptr);
}

TEST_F(FileEnumeratorTest, AFullPageEndsWithATokenOfItsOffsetAndSortOrder) {
  Page page{.items = {}, .nextOffset = 600, .error = nullptr};
  for (std::uint64_t id = 1; id <= 200; ++id) page.items.push_back(scriptedDocument(id, "item"));
  answerPageWith(page);
  const auto observer = list(qs_pageTokenFromSortOrder(1, 400));
  EXPECT_THAT(observer->items(), SizeIs(200));
  EXPECT_EQ(qs_pageTokenOffset(observer->nextPage()), 600U);
  EXPECT_EQ(qs_pageTokenSortOrder(observer->nextPage()), 1U);
}

TEST_F(FileEnumeratorTest, TheEnumeratorIsRegisteredBeforeTheFolderIsListed) {
  answerPageWith({});
  (void)list(nullptr);
  EXPECT_EQ(
      daemonCalls({"getItemUpdateSender", "watchItem", "enumerateItemsInFolder"}),
      (std::vector<std::string>{"getItemUpdateSender", "watchItem", "enumerateItemsInFolder"}));
}

TEST_F(FileEnumeratorTest, TheOuterSectionClosesBeforeTheReplyAndTheInnerOneAfterIt) {
  const Page page{.items = {scriptedDocument(5, "five")}, .nextOffset = 1, .error = nullptr};
  answerPageWith(page);
  daemon.hold("enumerateItemsInFolder");
  auto observer = std::make_shared<RecordingEnumerationObserver>();
  enumerator->enumerateItemsForObserver(observer, nullptr);
  ASSERT_TRUE(daemon.waitForCalls("enumerateItemsInFolder"));
  EXPECT_EQ(log.count(LogLevel::Debug, kClose), 1U);
  EXPECT_EQ(log.sectionOf(kClose), log.sectionOf(kOpen));
  daemon.release("enumerateItemsInFolder");
  ASSERT_TRUE(observer->waitUntilFinished());
  ASSERT_TRUE(log.waitFor(LogLevel::Debug, kClose, 2));

  const std::string received =
      "[DEBUG] ┳# received next page 1 items=(" + observer->items().at(0)->description() + ")";
  const std::vector<std::string> expected{kOpen, kCalling, kClose, received, kClose};
  EXPECT_EQ(among(log.texts(), expected), expected);
  EXPECT_EQ(log.sectionOf(received), log.sectionOf(kCalling));
  EXPECT_NE(log.sectionOf(kOpen), log.sectionOf(kCalling));
  EXPECT_EQ(log.sectionOf(kCalling) % 2, 1U);
}

TEST_F(FileEnumeratorTest, ADaemonErrorForThePageIsLoggedAndTranslatedAndClosesTheInnerSection) {
  const auto error = NSError::errorWithDomain(NSCocoaErrorDomain, 4354);
  answerPageWith({.items = {}, .nextOffset = 0, .error = error});
  const auto observer = list(nullptr);
  ASSERT_TRUE(log.waitFor(LogLevel::Debug, kClose, 2));
  EXPECT_THAT(observer->calls(), ElementsAre("error"));
  EXPECT_EQ(domainAndCode(observer->error()), "NSFileProviderErrorDomain -1003");
  const std::vector<std::string> expected{
      "[DEBUG] ┳# received next page 0 items=()",
      "[ERROR] there was an error when listing items: " + error->description()};
  EXPECT_EQ(among(log.texts(), expected), expected);
}

TEST_F(FileEnumeratorTest, AConnectionLostDuringTheListingFinishesWithTheConnectionsError) {
  answerPageWith({});
  daemon.hold("enumerateItemsInFolder");
  auto observer = std::make_shared<RecordingEnumerationObserver>();
  enumerator->enumerateItemsForObserver(observer, nullptr);
  ASSERT_TRUE(daemon.waitForCalls("enumerateItemsInFolder"));
  daemon.dropConnections();
  ASSERT_TRUE(observer->waitUntilFinished());
  EXPECT_THAT(observer->calls(), ElementsAre("error"));
  EXPECT_EQ(log.countContaining("received next page"), 0U);
  EXPECT_EQ(log.countContaining("there was an error when listing items"), 0U);
  // Whoever finished it lets go of it only when done. The inner section stays open.
  ASSERT_TRUE(daemon.waitUntil([&] { return observer.use_count() == 1; }));
  EXPECT_EQ(log.count(LogLevel::Debug, kClose), 1U);
  EXPECT_EQ(log.sectionOf(kClose), log.sectionOf(kOpen));
}

TEST_F(FileEnumeratorTest, ARefusedRegistrationFinishesTranslatedAndListsNothing) {
  daemon.script([](ScriptedDaemon::Answers& answers) {
    answers.getItemUpdateSender = [] { return qsc_errorLoggedOut(); };
  });
  const auto observer = list(nullptr);
  EXPECT_THAT(observer->calls(), ElementsAre("error"));
  EXPECT_EQ(domainAndCode(observer->error()), "NSFileProviderErrorDomain -1000");
  EXPECT_EQ(daemon.callCount("enumerateItemsInFolder"), 0U);
  // The inner section stays open.
  EXPECT_EQ(log.count(LogLevel::Debug, kClose), 1U);
  EXPECT_EQ(log.sectionOf(kClose), log.sectionOf(kOpen));
}

TEST_F(FileEnumeratorTest, AConnectionLostDuringTheRegistrationFinishesAndListsNothing) {
  daemon.hold("getItemUpdateSender");
  auto observer = std::make_shared<RecordingEnumerationObserver>();
  enumerator->enumerateItemsForObserver(observer, nullptr);
  ASSERT_TRUE(daemon.waitForCalls("getItemUpdateSender"));
  daemon.dropConnections();
  ASSERT_TRUE(observer->waitUntilFinished());
  EXPECT_THAT(observer->calls(), ElementsAre("error"));
  EXPECT_EQ(daemon.callCount("enumerateItemsInFolder"), 0U);
}

TEST_F(FileEnumeratorTest, AfterALostDaemonTheNextListingRegistersAndListsAgain) {
  answerPageWith({});
  daemon.stop();
  EXPECT_THAT(list(nullptr)->calls(), ElementsAre("error"));
  daemon.start();
  EXPECT_THAT(list(nullptr)->calls(), ElementsAre("items", "page"));
  EXPECT_EQ(daemon.subscriptionCount(), 1U);
}

TEST_F(FileEnumeratorTest, AnInvalidatedEnumeratorStillListsWithoutRegistering) {
  answerPageWith({.items = {scriptedDocument(5, "five")}, .nextOffset = 0, .error = nullptr});
  enumerator->invalidate();
  const auto observer = list(nullptr);
  EXPECT_THAT(observer->identifiers(), ElementsAre("d:5"));
  EXPECT_EQ(daemon.callCount("watchItem"), 0U);
  EXPECT_TRUE(daemon.waitForCalls("invalidate"));
}

}  // namespace
}  // namespace yomber
