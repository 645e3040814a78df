#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "provider/enumeration/directories_enumerator.h"
#include "provider/enumeration/file_enumerator.h"
#include "provider/enumeration/working_set_enumerator.h"
#include "provider/extension/extension.h"
#include "provider/testing/provider_fixture.h"

namespace yomber {
namespace {

using ::testing::Contains;
using Call = ScriptedDaemon::Call;

constexpr const char* kMethod =
    "-[QSFileProviderExtension enumeratorForContainerItemIdentifier:error:]";

template <typename Enumerator>
bool is(const NSFileProviderEnumeratorRef& enumerator) {
  return std::dynamic_pointer_cast<Enumerator>(enumerator) != nullptr;
}

class EnumeratorSelectionTest : public ProviderTest {
 protected:
  EnumeratorSelectionTest() { log.forget(); }

  std::shared_ptr<QSFileProviderExtension> extension = QSFileProviderExtension::init();
};

TEST_F(EnumeratorSelectionTest, TheWorkingSetHasItsOwnEnumeratorWithoutAURLLookup) {
  NSErrorRef error;
  EXPECT_TRUE(is<QSWorkingSetEnumerator>(extension->enumeratorForContainerItemIdentifier(
      NSFileProviderWorkingSetContainerItemIdentifier, &error)));
  EXPECT_EQ(error, nullptr);
  EXPECT_EQ(log.countContaining("asked url for"), 0U);
  EXPECT_EQ(log.count(LogLevel::Debug, "[DEBUG] ┏# enumerator for " +
                                           NSFileProviderWorkingSetContainerItemIdentifier),
            1U);
  EXPECT_EQ(log.count(LogLevel::Debug, "[DEBUG] ┗# "), 1U);
}

TEST_F(EnumeratorSelectionTest, AllDirectoriesHaveTheirOwnEnumeratorWithoutAURLLookup) {
  EXPECT_TRUE(is<QSDirectoriesEnumerator>(extension->enumeratorForContainerItemIdentifier(
      NSFileProviderAllDirectoriesContainerItemIdentifier, nullptr)));
  EXPECT_EQ(log.countContaining("asked url for"), 0U);
}

TEST_F(EnumeratorSelectionTest, EachRequestGetsANewEnumeratorThatTheExtensionDoesNotKeep) {
  daemon.addItem(scriptedFolder(5, "five"), inRoot("five"));
  auto first = extension->enumeratorForContainerItemIdentifier("i:5", nullptr);
  const auto second = extension->enumeratorForContainerItemIdentifier("i:5", nullptr);
  EXPECT_NE(first, second);
  const std::weak_ptr<NSFileProviderEnumerator> weak = first;
  first.reset();
  EXPECT_TRUE(weak.expired());
}

TEST_F(EnumeratorSelectionTest, AFolderGetsAFileEnumeratorOfItsIDAndURL) {
  daemon.addItem(scriptedFolder(5, "five"), inRoot("five"));
  const auto enumerator = extension->enumeratorForContainerItemIdentifier("i:5", nullptr);
  ASSERT_TRUE(is<QSFileEnumerator>(enumerator));
  auto observer = std::make_shared<RecordingEnumerationObserver>();
  enumerator->enumerateItemsForObserver(observer, nullptr);
  ASSERT_TRUE(observer->waitUntilFinished());
  ASSERT_TRUE(daemon.waitForCalls("watchItem"));
  EXPECT_THAT(daemon.calls(), Contains(Call{"enumerateItemsInFolder", {"i:5", "0", "0", "200"}}));
  EXPECT_THAT(daemon.calls(), Contains(Call{"watchItem", {"0", inRoot("five"), "19"}}));
}

TEST(RootEnumeratorSelection, TheRootGetsAFileEnumeratorWithoutAnIDAtTheRootsURL) {
  EXPECT_IN_FRESH_PROCESS({
    ProviderSurroundings around;
    const auto extension = QSFileProviderExtension::init();
    const auto enumerator = extension->enumeratorForContainerItemIdentifier(
        NSFileProviderRootContainerItemIdentifier, nullptr);
    ASSERT_TRUE(is<QSFileEnumerator>(enumerator));
    EXPECT_EQ(around.log.count(LogLevel::Debug, "[DEBUG] ┏# asked url for " +
                                                    NSFileProviderRootContainerItemIdentifier),
              1U);
    auto observer = std::make_shared<RecordingEnumerationObserver>();
    enumerator->enumerateItemsForObserver(observer, nullptr);
    ASSERT_TRUE(observer->waitUntilFinished());
    ASSERT_TRUE(around.daemon.waitForCalls("watchItem"));
    EXPECT_THAT(around.daemon.calls(),
                Contains(Call{"enumerateItemsInFolder", {"", "0", "0", "200"}}));
    EXPECT_THAT(around.daemon.calls(),
                Contains(Call{"watchItem", {"0", around.daemon.root(), "19"}}));
  });
}

TEST_F(EnumeratorSelectionTest, AFolderWithoutAURLIsTheFrameworksMissingItem) {
  NSErrorRef error;
  EXPECT_EQ(extension->enumeratorForContainerItemIdentifier("nothing", &error), nullptr);
  EXPECT_EQ(domainAndCode(error), "NSFileProviderErrorDomain -1005");
  EXPECT_TRUE(error->userInfo().contains(NSFileProviderErrorNonExistentItemIdentifierKey));
  EXPECT_EQ(log.count(LogLevel::Error, std::string("[ERROR] ") + kMethod +
                                           ": (passed to caller) error: " + error->description()),
            1U);
}

TEST_F(EnumeratorSelectionTest, AMissingFolderIsLoggedAsIgnoredWithoutAnOutParameter) {
  EXPECT_EQ(extension->enumeratorForContainerItemIdentifier("nothing", nullptr), nullptr);
  EXPECT_EQ(
      log.countContaining(std::string("[ERROR] ") + kMethod + ": (ignored by caller) error: "), 1U);
  EXPECT_EQ(log.count(LogLevel::Debug, "[DEBUG] ┗# "), 2U);
}

TEST_F(EnumeratorSelectionTest, WhenNobodyIsSignedInThereIsNoEnumeratorOfAnyKind) {
  setAccount({});
  for (const auto& identifier :
       {NSFileProviderWorkingSetContainerItemIdentifier,
        NSFileProviderAllDirectoriesContainerItemIdentifier,
        NSFileProviderRootContainerItemIdentifier, NSFileProviderItemIdentifier("i:5")}) {
    log.forget();
    NSErrorRef error;
    EXPECT_EQ(extension->enumeratorForContainerItemIdentifier(identifier, &error), nullptr);
    EXPECT_EQ(domainAndCode(error), "NSFileProviderErrorDomain -1000");
    EXPECT_EQ(log.count(LogLevel::Debug, "[DEBUG] ┏# enumerator for " + identifier), 1U);
    EXPECT_EQ(log.count(LogLevel::Debug, "[DEBUG] ┗# "), 1U);
    EXPECT_EQ(log.countContaining(kMethod), 0U);
  }
}

}  // namespace
}  // namespace yomber
