#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <thread>
#include <vector>

#include "platform/ostrell/errors.h"
#include "platform/ostrell/url_additions.h"
#include "provider/extension/extension.h"
#include "provider/testing/provider_fixture.h"

namespace yomber {
namespace {

using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

using Call = ScriptedDaemon::Call;
using Location = ScriptedDaemon::Location;

constexpr const char* kBookmarkLine = "[DEBUG] we have a bookmark, returning its target";
constexpr const char* kClose = "[DEBUG] ┗# ";

std::string urlOf(const std::string& path) {
  return NSURL::fileURLWithPath(path)->absoluteString();
}

class ItemLookupTest : public ProviderTest {
 protected:
  ItemLookupTest() { log.forget(); }

  /// A symbolic link `name` in the root that leads to `target`.
  std::string makeLink(const std::string& name, const std::string& target) {
    const std::string path = inRoot(name);
    EXPECT_EQ(symlink(target.c_str(), path.c_str()), 0);
    return path;
  }
  std::string makeFolder(const std::string& name) {
    const std::string path = inRoot(name);
    EXPECT_EQ(mkdir(path.c_str(), 0700), 0);
    return path;
  }
  void answerDocumentLocationWith(const Location& location) {
    daemon.script([&](ScriptedDaemon::Answers& answers) {
      answers.documentLocation = [location](const QSFileObjectID&) { return location; };
    });
  }
  void answerURLForItemIdentifierWith(const Location& location) {
    daemon.script([&](ScriptedDaemon::Answers& answers) {
      answers.urlForItemIdentifier = [location](const std::string&) { return location; };
    });
  }
  void answerItemAtLocationWith(const ScriptedDaemon::Item& item) {
    daemon.script([&](ScriptedDaemon::Answers& answers) {
      answers.itemAtLocation = [item](const std::string&, bool) { return item; };
    });
  }
  /// A container of an application, with its Documents folder's location.
  std::string addContainer() {
    const std::string path = daemon.home() + "/tree/org.example.Notes/Documents";
    daemon.addContainer({.containerID = "org.example.Notes",
                         .displayName = "Notes",
                         .documentsPath = path,
                         .applicationID = "org.example.Notes",
                         .iconName = ""});
    return path;
  }
  std::string privatePath() const { return daemon.home() + "/tree/.Promises/5"; }
  static std::string warningOf(const std::string& path, const std::string& identifier) {
    return "[WARNING] Detected url in private or excluded location " + path +
           " -- Fetching URL from daemon for " + identifier;
  }
  static std::string pathOf(const NSURLRef& url) { return url == nullptr ? "nil" : url->path(); }

  std::shared_ptr<QSFileProviderExtension> extension = QSFileProviderExtension::init();
};

// ---- Identifier to location --------------------------------------------------------------------

TEST_F(ItemLookupTest, AnIdentifierYieldsItsLocationInsideOneSection) {
  daemon.addItem(scriptedDocument(5, "five.txt"), inRoot("five.txt"));
  EXPECT_EQ(pathOf(extension->URLForItemWithPersistentIdentifier("d:5")), inRoot("five.txt"));
  const std::vector<std::string> expected{"[DEBUG] ┏# asked url for d:5",
                                          "[DEBUG] returning " + urlOf(inRoot("five.txt")), kClose};
  EXPECT_EQ(among(log.texts(), expected), expected);
  EXPECT_EQ(log.sectionOf(expected[0]), log.sectionOf(kClose));
  EXPECT_EQ(log.sectionOf(kClose) % 2, 1U);
}

TEST_F(ItemLookupTest, AStringThatIsNoIdentifierYieldsNilAndNoError) {
  EXPECT_EQ(extension->URLForItemWithPersistentIdentifier("no such thing"), nullptr);
  EXPECT_EQ(log.count(LogLevel::Error, "[ERROR] returning nil, there was an error: (null)"), 1U);
  EXPECT_EQ(log.count(LogLevel::Debug, kClose), 1U);
  EXPECT_EQ(daemon.callCount("documentLocation"), 0U);
}

TEST_F(ItemLookupTest, AnIdentifierThatTheDaemonDoesNotKnowYieldsNilAndItsError) {
  answerDocumentLocationWith({.path = {}, .error = NSError::errorWithDomain("SomeDomain", 6)});
  EXPECT_EQ(extension->URLForItemWithPersistentIdentifier("d:5"), nullptr);
  EXPECT_EQ(log.countContaining("[ERROR] returning nil, there was an error: "), 1U);
  EXPECT_EQ(log.countContaining("SomeDomain"), 1U);
}

TEST_F(ItemLookupTest, ABookmarkYieldsItsTargetWhenResolving) {
  const std::string target = makeFolder("target");
  const std::string bookmark = makeLink("bookmark", target);
  daemon.addItem(scriptedDocument(6, "bookmark"), bookmark);
  EXPECT_EQ(pathOf(extension->_URLForItemWithPersistentIdentifier("d:6", ResolveAliases::Yes)),
            target);
  EXPECT_EQ(log.count(LogLevel::Debug, kBookmarkLine), 1U);
  EXPECT_EQ(pathOf(extension->URLForItemWithPersistentIdentifier("d:6")), target);
}

TEST_F(ItemLookupTest, ABookmarkYieldsItselfWhenNotResolving) {
  const std::string bookmark = makeLink("bookmark", makeFolder("target"));
  daemon.addItem(scriptedDocument(6, "bookmark"), bookmark);
  EXPECT_EQ(pathOf(extension->_URLForItemWithPersistentIdentifier("d:6", ResolveAliases::No)),
            bookmark);
  EXPECT_EQ(log.count(LogLevel::Debug, kBookmarkLine), 0U);
}

TEST_F(ItemLookupTest, ABookmarkThatLeadsNowhereYieldsNilAndWhyItCannotBeResolved) {
  const std::string bookmark = makeLink("bookmark", inRoot("missing"));
  daemon.addItem(scriptedDocument(6, "bookmark"), bookmark);
  NSErrorRef reason;
  ASSERT_EQ(qs_URLByResolvingExternalDocumentReferenceWithError(NSURL::fileURLWithPath(bookmark),
                                                                &reason),
            nullptr);
  log.forget();
  EXPECT_EQ(pathOf(extension->URLForItemWithPersistentIdentifier("d:6")), "nil");
  const std::vector<std::string> expected{
      "[DEBUG] ┏# asked url for d:6", kBookmarkLine,
      "[ERROR] returning nil, there was an error: " + reason->description(), kClose};
  EXPECT_EQ(among(log.texts(), expected), expected);
  EXPECT_EQ(log.count(LogLevel::Error, expected[2]), 1U);
}

TEST_F(ItemLookupTest, APrivateLocationIsReplacedByTheDaemons) {
  daemon.addItem(scriptedDocument(5, "five.txt"), privatePath());
  answerURLForItemIdentifierWith({.path = inRoot("five.txt"), .error = nullptr});
  EXPECT_EQ(pathOf(extension->URLForItemWithPersistentIdentifier("d:5")), inRoot("five.txt"));
  EXPECT_EQ(log.count(LogLevel::Default, warningOf(privatePath(), "d:5")), 1U);
  EXPECT_THAT(daemon.calls(), Contains(Call{"urlForItemIdentifier", {"d:5"}}));
  EXPECT_EQ(log.countContaining("Failed getting url"), 0U);
}

TEST_F(ItemLookupTest, AnExcludedLocationIsReplacedByTheDaemons) {
  const std::string excluded = inRoot("folder.nosync/five.txt");
  daemon.addItem(scriptedDocument(5, "five.txt"), excluded);
  answerURLForItemIdentifierWith({.path = inRoot("five.txt"), .error = nullptr});
  EXPECT_EQ(pathOf(extension->URLForItemWithPersistentIdentifier("d:5")), inRoot("five.txt"));
  EXPECT_EQ(log.count(LogLevel::Default, warningOf(excluded, "d:5")), 1U);
}

TEST_F(ItemLookupTest, AnExcludedLocationStaysWhenTheDaemonHasNoAnswer) {
  const std::string excluded = inRoot("five.nosync");
  const auto error = NSError::errorWithDomain("SomeDomain", 6);
  daemon.addItem(scriptedDocument(5, "five.nosync"), excluded);
  answerURLForItemIdentifierWith({.path = {}, .error = error});
  EXPECT_EQ(pathOf(extension->URLForItemWithPersistentIdentifier("d:5")), excluded);
  EXPECT_EQ(log.countContaining("[WARNING] Failed getting url of d:5 - "), 1U);
  EXPECT_EQ(log.countContaining("SomeDomain"), 1U);
  EXPECT_EQ(log.count(LogLevel::Debug, "[DEBUG] returning " + urlOf(excluded)), 1U);
}

TEST_F(ItemLookupTest, ALocationThatTheDaemonSuppliesOutsideTheTreeYieldsNil) {
  daemon.addItem(scriptedDocument(5, "five.txt"), privatePath());
  answerURLForItemIdentifierWith({.path = "/etc/passwd", .error = nullptr});
  EXPECT_EQ(extension->URLForItemWithPersistentIdentifier("d:5"), nullptr);
  EXPECT_EQ(log.count(LogLevel::Debug, "[DEBUG] returning file:///etc/passwd"), 1U);
  EXPECT_EQ(log.countContaining("[ERROR]"), 0U);
}

TEST_F(ItemLookupTest, ALocationOutsideTheTreeYieldsNilWithoutAnError) {
  answerDocumentLocationWith({.path = "/etc/passwd", .error = nullptr});
  EXPECT_EQ(extension->URLForItemWithPersistentIdentifier("d:5"), nullptr);
  EXPECT_EQ(log.count(LogLevel::Debug, "[DEBUG] returning file:///etc/passwd"), 1U);
  EXPECT_EQ(log.countContaining("[ERROR]"), 0U);
}

TEST_F(ItemLookupTest, OnlyAttachingMarksTheLocationAsPhysical) {
  daemon.addItem(scriptedDocument(5, "five.txt"), inRoot("five.txt"));
  const auto marked = extension->_URLForItemWithPersistentIdentifier("d:5", ResolveAliases::Yes,
                                                                     AttachPhysical::Yes);
  ASSERT_NE(marked, nullptr);
  EXPECT_TRUE(marked->hasMark(NSURL::Mark::Physical));
  const auto plain = extension->_URLForItemWithPersistentIdentifier("d:5", ResolveAliases::Yes,
                                                                    AttachPhysical::No);
  EXPECT_FALSE(plain->hasMark(NSURL::Mark::Physical));
  EXPECT_FALSE(extension->_URLForItemWithPersistentIdentifier("d:5", ResolveAliases::Yes)
                   ->hasMark(NSURL::Mark::Physical));
}

TEST(RootLookup, TheRootIsTheDefaultContainersDocumentsWithoutAPhysicalMark) {
  EXPECT_IN_FRESH_PROCESS({
    const ProviderSurroundings around;
    const auto extension = QSFileProviderExtension::init();
    const auto root = extension->_URLForItemWithPersistentIdentifier(
        NSFileProviderRootContainerItemIdentifier, ResolveAliases::Yes, AttachPhysical::Yes);
    ASSERT_NE(root, nullptr);
    EXPECT_EQ(root->path(), around.daemon.root());
    EXPECT_FALSE(root->hasMark(NSURL::Mark::Physical));
    const std::vector<std::string> expected{
        "[DEBUG] ┏# asked url for NSFileProviderRootContainerItemIdentifier",
        "[DEBUG] returning " + root->absoluteString(), kClose};
    EXPECT_EQ(among(around.log.texts(), expected), expected);
  });
}

TEST(RootLookup, TheRootIsNotTestedForBeingInTheTree) {
  EXPECT_IN_FRESH_PROCESS({
    ProviderSurroundings around;
    around.daemon.script([](ScriptedDaemon::Answers& answers) {
      answers.containers = [] {
        return std::vector{ScriptedDaemon::Container{.containerID = QSUbiquitousDefaultContainerID,
                                                     .displayName = "Drive",
                                                     .documentsPath = "/elsewhere",
                                                     .applicationID = "",
                                                     .iconName = ""}};
      };
    });
    const auto extension = QSFileProviderExtension::init();
    const auto root =
        extension->URLForItemWithPersistentIdentifier(NSFileProviderRootContainerItemIdentifier);
    ASSERT_NE(root, nullptr);
    EXPECT_EQ(root->path(), "/elsewhere");
  });
}

TEST(RootLookup, TheRootIsComputedOnceAlsoByConcurrentFirstCallsAndNeverRefreshed) {
  EXPECT_IN_FRESH_PROCESS({
    ProviderSurroundings around;
    const auto extension = QSFileProviderExtension::init();
    std::vector<NSURLRef> roots(8);
    std::vector<std::thread> threads;
    for (auto& root : roots) {
      threads.emplace_back([&extension, &root] {
        root = extension->URLForItemWithPersistentIdentifier(
            NSFileProviderRootContainerItemIdentifier);
      });
    }
    for (auto& thread : threads) thread.join();
    ASSERT_NE(roots[0], nullptr);
    EXPECT_THAT(roots, ::testing::Each(roots[0]));
    around.daemon.stop();
    EXPECT_EQ(
        extension->URLForItemWithPersistentIdentifier(NSFileProviderRootContainerItemIdentifier),
        roots[0]);
  });
}

TEST(RootLookup, ARootThatWasNilWhenFirstComputedStaysNil) {
  EXPECT_IN_FRESH_PROCESS({
    ProviderSurroundings around;
    const auto extension = QSFileProviderExtension::init();
    around.daemon.stop();
    EXPECT_EQ(
        extension->URLForItemWithPersistentIdentifier(NSFileProviderRootContainerItemIdentifier),
        nullptr);
    EXPECT_EQ(around.log.count(LogLevel::Debug, "[DEBUG] returning (null)"), 1U);
    EXPECT_EQ(around.log.countContaining("returning nil, there was an error"), 0U);
    around.daemon.start();
    EXPECT_EQ(
        extension->URLForItemWithPersistentIdentifier(NSFileProviderRootContainerItemIdentifier),
        nullptr);
  });
}

// ---- Location to identifier --------------------------------------------------------------------

TEST_F(ItemLookupTest, ALocationYieldsItsIdentifierInsideASection) {
  daemon.addItem(scriptedDocument(5, "five.txt"), inRoot("five.txt"));
  const auto url = NSURL::fileURLWithPath(inRoot("five.txt"));
  EXPECT_EQ(extension->persistentIdentifierForItemAtURL(url), "d:5");
  const std::vector<std::string> expected{"[DEBUG] ┏# asked identifier for " + url->path(),
                                          "[DEBUG] ┏# asked properties for " + url->path(), kClose,
                                          "[DEBUG] returning d:5", kClose};
  EXPECT_EQ(among(log.texts(), expected), expected);
}

TEST_F(ItemLookupTest, ALocationOutsideTheTreeHasNoIdentifierAndOpensNoSection) {
  EXPECT_EQ(extension->persistentIdentifierForItemAtURL(NSURL::fileURLWithPath("/etc/passwd")),
            std::nullopt);
  EXPECT_EQ(extension->persistentIdentifierForItemAtURL(nullptr), std::nullopt);
  EXPECT_EQ(log.countContaining("┏"), 0U);
  EXPECT_EQ(log.countContaining("┗"), 0U);
  EXPECT_EQ(daemon.callCount("itemAtLocation"), 0U);
}

TEST_F(ItemLookupTest, ALocationThatCannotBeDescribedHasNoIdentifier) {
  answerItemAtLocationWith({.item = {}, .error = NSError::errorWithDomain("SomeDomain", 6)});
  const auto url = NSURL::fileURLWithPath(inRoot("five.txt"));
  EXPECT_EQ(extension->persistentIdentifierForItemAtURL(url), std::nullopt);
  EXPECT_EQ(log.countContaining("[DEBUG] couldn't get item identifier at " + url->absoluteString() +
                                ": "),
            1U);
  EXPECT_EQ(log.count(LogLevel::Debug, "[DEBUG] returning (null)"), 2U);
}

TEST_F(ItemLookupTest, AContainersFolderWithoutAnItemHasNoIdentifierAndNoError) {
  const auto url = NSURL::fileURLWithPath(addContainer());
  daemon.script([](ScriptedDaemon::Answers& answers) {
    answers.containerItem = [](const std::string&, bool) {
      return ScriptedDaemon::Item{.item = {}, .error = NSError::errorWithDomain("SomeDomain", 6)};
    };
  });
  EXPECT_EQ(extension->persistentIdentifierForItemAtURL(url), std::nullopt);
  EXPECT_EQ(log.countContaining("couldn't get item identifier"), 0U);
}

// ---- Identifier to item ------------------------------------------------------------------------

TEST_F(ItemLookupTest, AnIdentifierYieldsTheDaemonsItem) {
  daemon.addItem(scriptedDocument(5, "five.txt"), inRoot("five.txt"));
  NSErrorRef error;
  const auto item = extension->itemForIdentifier("d:5", &error);
  ASSERT_NE(item, nullptr);
  EXPECT_EQ(item->fields(), scriptedDocument(5, "five.txt"));
  EXPECT_EQ(error, nullptr);
  EXPECT_THAT(daemon.calls(), Contains(Call{"itemAtLocation", {inRoot("five.txt"), "false"}}));
  const std::vector<std::string> expected{"[DEBUG] ┏# asked properties for d:5",
                                          "[DEBUG] ┏# asked url for d:5"};
  EXPECT_EQ(among(log.texts(), expected), expected);
  EXPECT_EQ(log.count(LogLevel::Debug, "[DEBUG] returning " + item->description()), 2U);
  EXPECT_EQ(log.count(LogLevel::Debug, kClose), 3U);
}

TEST_F(ItemLookupTest, ABookmarksIdentifierYieldsItsTargetsItem) {
  const std::string target = makeFolder("target");
  daemon.addItem(scriptedDocument(6, "bookmark"), makeLink("bookmark", target));
  daemon.addItem(scriptedFolder(7, "target"), target);
  const auto item = extension->itemForIdentifier("d:6", nullptr);
  ASSERT_NE(item, nullptr);
  EXPECT_EQ(item->itemIdentifier(), "i:7");
}

TEST_F(ItemLookupTest, ABookmarkThatLeadsNowhereIsTheFrameworksMissingItem) {
  daemon.addItem(scriptedDocument(6, "bookmark"), makeLink("bookmark", inRoot("missing")));
  NSErrorRef error;
  EXPECT_EQ(extension->itemForIdentifier("d:6", &error), nullptr);
  EXPECT_EQ(domainAndCode(error), "NSFileProviderErrorDomain -1005");
  EXPECT_TRUE(error->userInfo().contains(NSFileProviderErrorNonExistentItemIdentifierKey));
  EXPECT_EQ(daemon.callCount("itemAtLocation"), 0U);
}

TEST_F(ItemLookupTest, WhenNobodyIsSignedInTheDaemonIsNeverAskedForTheItem) {
  setAccount({});
  daemon.addItem(scriptedDocument(5, "five.txt"), inRoot("five.txt"));
  NSErrorRef error;
  EXPECT_EQ(extension->itemForIdentifier("d:5", &error), nullptr);
  EXPECT_EQ(domainAndCode(error), "NSFileProviderErrorDomain -1000");
  EXPECT_EQ(daemon.callCount("documentLocation"), 0U);
  EXPECT_EQ(daemon.callCount("itemAtLocation"), 0U);
  EXPECT_EQ(log.countContaining("asked url for"), 0U);
  EXPECT_EQ(log.countContaining("-[QSFileProviderExtension itemForIdentifier:error:]"), 0U);
  EXPECT_EQ(log.count(LogLevel::Debug, kClose), 1U);
}

TEST_F(ItemLookupTest, AnIdentifierWithoutALocationIsTheFrameworksMissingItem) {
  NSErrorRef error;
  EXPECT_EQ(extension->itemForIdentifier("nothing", &error), nullptr);
  EXPECT_EQ(domainAndCode(error), "NSFileProviderErrorDomain -1005");
  ASSERT_TRUE(error->userInfo().contains(NSFileProviderErrorNonExistentItemIdentifierKey));
  EXPECT_EQ(log.count(LogLevel::Error,
                      "[ERROR] -[QSFileProviderExtension itemForIdentifier:error:]: (passed to "
                      "caller) error: " +
                          error->description()),
            1U);
}

TEST_F(ItemLookupTest, AMissingItemIsLoggedAsIgnoredWithoutAnOutParameter) {
  EXPECT_EQ(extension->itemForIdentifier("nothing", nullptr), nullptr);
  EXPECT_EQ(log.countContaining("[ERROR] -[QSFileProviderExtension itemForIdentifier:error:]: "
                                "(ignored by caller) error: "),
            1U);
}

TEST_F(ItemLookupTest, ADaemonFailureIsAnsweredConverted) {
  daemon.addItem(scriptedDocument(5, "five.txt"), inRoot("five.txt"));
  answerItemAtLocationWith(
      {.item = {}, .error = NSError::errorWithDomain(NSCocoaErrorDomain, 4354)});
  NSErrorRef error;
  EXPECT_EQ(extension->itemForIdentifier("d:5", &error), nullptr);
  EXPECT_EQ(domainAndCode(error), "NSFileProviderErrorDomain -1003");
  EXPECT_EQ(domainAndCode(error->underlyingError()), "NSCocoaErrorDomain 4354");
  EXPECT_EQ(log.countContaining("[ERROR]"), 0U);
  EXPECT_EQ(log.count(LogLevel::Debug, "[DEBUG] returning (null)"), 2U);
}

// ---- Location to item --------------------------------------------------------------------------

TEST_F(ItemLookupTest, ALocationOutsideTheTreeIsNoSuchItemWithoutInformationAndWithoutASection) {
  NSErrorRef error;
  EXPECT_EQ(extension->_propertiesForItemAtURL(NSURL::fileURLWithPath("/etc/passwd"), &error),
            nullptr);
  EXPECT_EQ(domainAndCode(error), "NSFileProviderErrorDomain -1005");
  EXPECT_TRUE(error->userInfo().empty());
  EXPECT_EQ(extension->_propertiesForItemAtURL(nullptr, nullptr), nullptr);
  EXPECT_EQ(log.countContaining("┏"), 0U);
}

TEST_F(ItemLookupTest, OnlyNewItemsAreScannedBeforeTheyAreDescribed) {
  daemon.addItem(scriptedDocument(5, "five.txt"), inRoot("five.txt"));
  const auto url = NSURL::fileURLWithPath(inRoot("five.txt"));
  NSErrorRef error;
  EXPECT_NE(extension->_propertiesForNewItemAtURL(url, &error), nullptr);
  EXPECT_NE(extension->_propertiesForItemAtURL(url, &error), nullptr);
  EXPECT_NE(extension->_propertiesForItemAtURL(url, ForceScan::Yes, nullptr), nullptr);
  std::vector<Call> asked;
  for (const auto& call : daemon.calls()) {
    if (call.method == "itemAtLocation") asked.push_back(call);
  }
  EXPECT_THAT(asked, ElementsAre(Call{"itemAtLocation", {url->path(), "true"}},
                                 Call{"itemAtLocation", {url->path(), "false"}},
                                 Call{"itemAtLocation", {url->path(), "true"}}));
  EXPECT_EQ(error, nullptr);
}

TEST_F(ItemLookupTest, AContainersFolderIsDescribedAsItsContainer) {
  const auto url = NSURL::fileURLWithPath(addContainer());
  daemon.script([](ScriptedDaemon::Answers& answers) {
    answers.containerItem = [](const std::string&, bool) {
      return ScriptedDaemon::Item{.item = scriptedFolder(9, "Notes"), .error = nullptr};
    };
  });
  const auto item = extension->_propertiesForItemAtURL(url, ForceScan::Yes, nullptr);
  ASSERT_NE(item, nullptr);
  EXPECT_EQ(item->itemIdentifier(), "i:9");
  EXPECT_THAT(daemon.calls(), Contains(Call{"containerItem", {"org.example.Notes", "true"}}));
  EXPECT_EQ(daemon.callCount("itemAtLocation"), 0U);
}

TEST_F(ItemLookupTest, AContainersFolderNeverFailsWithAnErrorAlsoWhenItHasNoItem) {
  const auto url = NSURL::fileURLWithPath(addContainer());
  daemon.script([](ScriptedDaemon::Answers& answers) {
    answers.containerItem = [](const std::string&, bool) {
      return ScriptedDaemon::Item{.item = {}, .error = NSError::errorWithDomain("SomeDomain", 6)};
    };
  });
  NSErrorRef error;
  EXPECT_EQ(extension->_propertiesForItemAtURL(url, ForceScan::No, &error), nullptr);
  EXPECT_EQ(error, nullptr);
  EXPECT_EQ(log.count(LogLevel::Debug, "[DEBUG] returning (null)"), 1U);
}

TEST_F(ItemLookupTest, DocumentsAndDesktopAreOrdinaryFolders) {
  for (const auto& name : {QSUbiquitousDocumentsFolderName, QSUbiquitousDesktopFolderName}) {
    daemon.forgetCalls();
    daemon.addItem(scriptedFolder(11, name), inRoot(name));
    EXPECT_NE(extension->_propertiesForItemAtURL(NSURL::fileURLWithPath(inRoot(name)), nullptr),
              nullptr);
    EXPECT_THAT(daemon.calls(), Contains(Call{"itemAtLocation", {inRoot(name), "false"}}));
    EXPECT_EQ(daemon.callCount("containerItem"), 0U);
  }
}

TEST_F(ItemLookupTest, AnErrorThatThePointerAlreadyHeldIsConvertedToo) {
  daemon.addItem(scriptedDocument(5, "five.txt"), inRoot("five.txt"));
  NSErrorRef error = qsc_errorLoggedOut();
  EXPECT_NE(extension->_propertiesForItemAtURL(NSURL::fileURLWithPath(inRoot("five.txt")), &error),
            nullptr);
  EXPECT_EQ(domainAndCode(error), "NSFileProviderErrorDomain -1000");
}

TEST_F(ItemLookupTest, ALostDaemonFailsALookupInsteadOfHangingIt) {
  daemon.addItem(scriptedDocument(5, "five.txt"), inRoot("five.txt"));
  EXPECT_NE(extension->itemForIdentifier("d:5", nullptr), nullptr);
  daemon.hold("itemAtLocation");
  NSErrorRef error;
  NSFileProviderItemRef item;
  std::thread lookup([&] { item = extension->itemForIdentifier("d:5", &error); });
  EXPECT_TRUE(daemon.waitForCalls("itemAtLocation", 2));
  daemon.dropConnections();
  lookup.join();
  EXPECT_EQ(item, nullptr);
  EXPECT_NE(error, nullptr);
}

TEST_F(ItemLookupTest, LookupsRunConcurrently) {
  for (std::uint64_t id = 1; id <= 8; ++id) {
    const std::string name = "file" + std::to_string(id);
    daemon.addItem(scriptedDocument(id, name), inRoot(name));
  }
  daemon.hold("itemAtLocation");
  std::vector<std::thread> threads;
  std::vector<NSFileProviderItemRef> items(8);
  for (std::size_t i = 0; i < items.size(); ++i) {
    threads.emplace_back(
        [&, i] { items[i] = extension->itemForIdentifier("d:" + std::to_string(i + 1), nullptr); });
  }
  // All eight wait for the daemon at the same time.
  EXPECT_TRUE(daemon.waitForCalls("itemAtLocation", 8));
  daemon.release("itemAtLocation");
  for (auto& thread : threads) thread.join();
  for (std::size_t i = 0; i < items.size(); ++i) {
    ASSERT_NE(items[i], nullptr);
    EXPECT_EQ(items[i]->itemIdentifier(), "d:" + std::to_string(i + 1));
  }
}

}  // namespace
}  // namespace yomber
