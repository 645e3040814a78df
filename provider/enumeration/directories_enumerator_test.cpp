#include "provider/enumeration/directories_enumerator.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "platform/ostrell/errors.h"
#include "provider/enumeration/page_tokens.h"
#include "provider/testing/provider_fixture.h"

namespace yomber {
namespace {

using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::SizeIs;

using Call = ScriptedDaemon::Call;
using Page = ScriptedDaemon::Page;

class DirectoriesEnumeratorTest : public ProviderTest {
 protected:
  void answerWith(const Page& page) {
    daemon.script([&page](ScriptedDaemon::Answers& answers) {
      answers.enumerateAllFolders = [page](std::uint8_t, std::uint64_t, std::uint32_t) {
        return page;
      };
    });
  }
  std::shared_ptr<RecordingEnumerationObserver> list(const NSFileProviderPage& page) {
    auto observer = std::make_shared<RecordingEnumerationObserver>();
    enumerator->enumerateItemsForObserver(observer, page);
    EXPECT_TRUE(observer->waitUntilFinished());
    return observer;
  }

  std::shared_ptr<QSDirectoriesEnumerator> enumerator = std::make_shared<QSDirectoriesEnumerator>();
};

TEST_F(DirectoriesEnumeratorTest, NextOffsetZeroFinishesWithANilPage) {
  answerWith({.items = {scriptedFolder(5, "five"), scriptedFolder(6, "six")},
              .nextOffset = 0,
              .error = nullptr});
  const auto observer = list(NSFileProviderInitialPageSortedByName);
  EXPECT_THAT(observer->calls(), ElementsAre("items", "page"));
  EXPECT_THAT(observer->identifiers(), ElementsAre("i:5", "i:6"));
  EXPECT_EQ(observer->nextPage(), nullptr);
}

TEST_F(DirectoriesEnumeratorTest, AFullPageFinishesWithATokenOfItsOffsetAndSortOrder) {
  Page page{.items = {}, .nextOffset = 200, .error = nullptr};
  for (std::uint64_t id = 1; id <= 200; ++id) page.items.push_back(scriptedFolder(id, "folder"));
  answerWith(page);
  const auto observer = list(NSFileProviderInitialPageSortedByDate);
  EXPECT_THAT(observer->items(), SizeIs(200));
  ASSERT_NE(observer->nextPage(), nullptr);
  EXPECT_EQ(qs_pageTokenOffset(observer->nextPage()), 200U);
  EXPECT_EQ(qs_pageTokenSortOrder(observer->nextPage()), 1U);
  EXPECT_THAT(daemon.calls(), Contains(Call{"enumerateAllFolders", {"1", "0", "200"}}));
}

TEST_F(DirectoriesEnumeratorTest, ALaterPageAsksFromItsOffset) {
  answerWith({});
  const auto observer = list(qs_pageTokenFromSortOrder(1, 400));
  EXPECT_EQ(observer->nextPage(), nullptr);
  EXPECT_THAT(daemon.calls(), Contains(Call{"enumerateAllFolders", {"1", "400", "200"}}));
}

TEST_F(DirectoriesEnumeratorTest, ANilStartPageListsByNameFromTheBeginning) {
  answerWith({});
  (void)list(nullptr);
  EXPECT_THAT(daemon.calls(), Contains(Call{"enumerateAllFolders", {"0", "0", "200"}}));
}

TEST_F(DirectoriesEnumeratorTest, ADaemonErrorIsLoggedAndTranslated) {
  const auto error = NSError::errorWithDomain(NSCocoaErrorDomain, 4354);
  answerWith({.items = {}, .nextOffset = 0, .error = error});
  const auto observer = list(nullptr);
  EXPECT_THAT(observer->calls(), ElementsAre("error"));
  EXPECT_EQ(domainAndCode(observer->error()), "NSFileProviderErrorDomain -1003");
  EXPECT_EQ(domainAndCode(observer->error()->underlyingError()), "NSCocoaErrorDomain 4354");
  EXPECT_EQ(log.count(LogLevel::Error,
                      "[ERROR] there was an error when listing items: " + error->description()),
            1U);
}

TEST_F(DirectoriesEnumeratorTest, ALostConnectionFinishesWithTheRawErrorAndNoLine) {
  daemon.hold("enumerateAllFolders");
  auto observer = std::make_shared<RecordingEnumerationObserver>();
  enumerator->enumerateItemsForObserver(observer, nullptr);
  ASSERT_TRUE(daemon.waitForCalls("enumerateAllFolders"));
  daemon.dropConnections();
  ASSERT_TRUE(observer->waitUntilFinished());
  EXPECT_THAT(observer->calls(), ElementsAre("error"));
  ASSERT_NE(observer->error(), nullptr);
  EXPECT_NE(observer->error()->domain(), NSFileProviderErrorDomain);
  EXPECT_EQ(log.countContaining("there was an error when listing items"), 0U);
}

TEST_F(DirectoriesEnumeratorTest, AListingInFlightStillFinishesAfterInvalidation) {
  answerWith({.items = {scriptedFolder(5, "five")}, .nextOffset = 0, .error = nullptr});
  daemon.hold("enumerateAllFolders");
  auto observer = std::make_shared<RecordingEnumerationObserver>();
  enumerator->enumerateItemsForObserver(observer, nullptr);
  ASSERT_TRUE(daemon.waitForCalls("enumerateAllFolders"));
  enumerator->invalidate();
  enumerator.reset();
  EXPECT_FALSE(observer->isFinished());
  daemon.release("enumerateAllFolders");
  ASSERT_TRUE(observer->waitUntilFinished());
  EXPECT_THAT(observer->identifiers(), ElementsAre("i:5"));
}

TEST_F(DirectoriesEnumeratorTest, NoLogSectionIsOpened) {
  answerWith({});
  (void)list(nullptr);
  EXPECT_EQ(log.countContaining("┏"), 0U);
  EXPECT_EQ(log.countContaining("┗"), 0U);
}

TEST_F(DirectoriesEnumeratorTest, ItTellsNoChanges) {
  const NSFileProviderEnumeratorRef framework = enumerator;
  EXPECT_EQ(std::dynamic_pointer_cast<NSFileProviderChangeEnumerator>(framework), nullptr);
}

}  // namespace
}  // namespace yomber
