#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstdlib>

#include "platform/ostrell/errors.h"
#include "provider/testing/operations_fixture.h"

namespace yomber {
namespace {

using ::testing::Contains;
using Call = ScriptedDaemon::Call;

class DefaultApplicationContainerTest : public OperationsTest {
 protected:
  DefaultApplicationContainerTest() {
    setenv("XDG_DATA_HOME", (daemon.home() + "/applications-of-user").c_str(), 1);
    setenv("XDG_DATA_DIRS", (daemon.home() + "/applications-of-system").c_str(), 1);
  }
  ~DefaultApplicationContainerTest() override {
    unsetenv("XDG_DATA_HOME");
    unsetenv("XDG_DATA_DIRS");
  }

  void install(const std::string& keys) const {
    const std::string folder = daemon.home() + "/applications-of-user/applications";
    std::filesystem::create_directories(folder);
    std::ofstream(folder + "/org.example.Notes.desktop") << "[Desktop Entry]\n" << keys;
  }
  /// The container's folder, and the daemon's item for it.
  std::string addContainer(const std::string& containerID) {
    const std::string path = daemon.home() + "/tree/" + containerID + "/Documents";
    std::filesystem::create_directories(path);
    daemon.addContainer({containerID, "Notes", path, "org.example.Notes", ""});
    daemon.addItem(scriptedFolder(42, "Documents"), path);
    return path;
  }
  void ask(const std::optional<std::string>& bundleIdentifier = "org.example.Notes") {
    extension->_defaultApplicationContainerForBundleIdentifier(bundleIdentifier, into(items));
  }
  void answerLocationWith(const NSErrorRef& error) {
    daemon.scriptContent([&](ScriptedContentAnswers& answers) {
      answers.containerLocation = [error](const std::string&, bool) {
        return ScriptedContentAnswers::ContainerLocation{std::nullopt, error};
      };
    });
  }

  static constexpr const char* kOpen =
      "[DEBUG] ┏# lookup for default location of org.example.Notes";
};

// ---- Without an application ---------------------------------------------------------------------

// Each in a process of its own, since the root's location is kept for the life of a process.
TEST_F(DefaultApplicationContainerTest, WithoutABundleItIsTheDocumentsFolderWhichIsMade) {
  EXPECT_IN_FRESH_PROCESS({
    daemon.addItem(scriptedFolder(7, "Documents"), inRoot("Documents"));
    ask(std::nullopt);
    EXPECT_EQ(only(items).identifier(), "i:7");
    EXPECT_TRUE(std::filesystem::is_directory(inRoot("Documents")));
    expectLines({"[DEBUG] ┏# lookup for default location of (null)",
                 "[DEBUG] creating default Documents folder",
                 "[DEBUG] ┏# creating directory Documents under "
                 "NSFileProviderRootContainerItemIdentifier"});
    EXPECT_EQ(daemon.callCount("containerLocation"), 0U);
  });
}

TEST_F(DefaultApplicationContainerTest, ForTheFilesBrowserItIsTheSameAlsoWhenItIsThere) {
  EXPECT_IN_FRESH_PROCESS({
    addFolder(7, "Documents");
    ask("com.kelvo.Bindra");
    EXPECT_EQ(only(items).identifier(), "i:7");
    EXPECT_EQ(log.countContaining("can't find bundle"), 0U);
  });
}

TEST_F(DefaultApplicationContainerTest, WhatStopsTheFoldersCreationIsTheAnswer) {
  EXPECT_IN_FRESH_PROCESS({
    addDocument(5, "Documents");
    ask(std::nullopt);
    const auto answer = only(items);
    EXPECT_EQ(answer.item, nullptr);
    EXPECT_EQ(domainAndCode(answer.error), "NSFileProviderErrorDomain -1001");
  });
}

// ---- For an application -------------------------------------------------------------------------

TEST_F(DefaultApplicationContainerTest, AnApplicationGetsItsFirstContainer) {
  addContainer("org.example.Second");
  install(
      "X-Yomber-Shared-Containers=org.example.Shared\n"
      "X-Yomber-Containers=org.example.Second;org.example.Third\n");
  ask();
  const auto answer = only(items);
  EXPECT_EQ(answer.identifier(), "i:42");
  EXPECT_EQ(answer.error, nullptr);
  EXPECT_THAT(daemon.calls(), Contains(Call{"containerLocation", {"org.example.Second", "true"}}));
  EXPECT_EQ(daemon.callCount("containerLocation"), 1U);
}

TEST_F(DefaultApplicationContainerTest, TheSectionClosesBeforeTheDaemonAnswers) {
  addContainer("org.example.Notes");
  install("X-Yomber-Containers=org.example.Notes\n");
  daemon.hold("containerLocation");
  ask();
  EXPECT_TRUE(isClosed(kOpen));
  ASSERT_TRUE(daemon.waitForCalls("containerLocation"));
  EXPECT_TRUE(items->values().empty());
  daemon.release("containerLocation");
  EXPECT_EQ(only(items).identifier(), "i:42");
}

TEST_F(DefaultApplicationContainerTest, AnUnknownBundleIsAnInvalidParameter) {
  ask("org.example.Nobody");
  const auto answer = only(items);
  EXPECT_EQ(answer.item, nullptr);
  ASSERT_EQ(domainAndCode(answer.error), "QSOstrellErrorDomain 3");
  EXPECT_EQ(std::get<std::string>(answer.error->userInfo().at(QSOstrellErrorParameterKey)),
            "bundleIdentifier");
  EXPECT_EQ(std::get<std::string>(answer.error->userInfo().at(QSOstrellErrorValueKey)),
            "org.example.Nobody");
  EXPECT_EQ(log.count(LogLevel::Error, "[ERROR] can't find bundle with id 'org.example.Nobody'"),
            1U);
}

TEST_F(DefaultApplicationContainerTest, AnIdentifierAloneEntitlesToNothing) {
  install("Name=Notes\n");
  ask();
  const auto answer = only(items);
  ASSERT_EQ(domainAndCode(answer.error), "QSOstrellErrorDomain 1");
  EXPECT_TRUE(answer.error->userInfo().empty());
  EXPECT_EQ(answer.item, nullptr);
  EXPECT_EQ(log.count(LogLevel::Debug,
                      "[DEBUG] bundle 'org.example.Notes' is not entitled to used Yomber Drive"),
            1U);
  EXPECT_EQ(daemon.callCount("containerLocation"), 0U);
}

TEST_F(DefaultApplicationContainerTest, TheDocumentsServiceEntitlesToAContainerOfItsName) {
  addContainer("org.example.Notes");
  install("X-Yomber-Services=Documents\n");
  ask();
  EXPECT_EQ(only(items).identifier(), "i:42");
}

TEST_F(DefaultApplicationContainerTest, TheDaemonsErrorIsAnsweredTranslated) {
  install("X-Yomber-Containers=org.example.Notes\n");
  answerLocationWith(qsc_errorLoggedOut());
  ask();
  const auto answer = only(items);
  EXPECT_EQ(answer.item, nullptr);
  EXPECT_EQ(domainAndCode(answer.error), "NSFileProviderErrorDomain -1000");
}

TEST_F(DefaultApplicationContainerTest, ALostDaemonIsAnsweredOnce) {
  install("X-Yomber-Containers=org.example.Notes\n");
  daemon.hold("containerLocation");
  ask();
  ASSERT_TRUE(daemon.waitForCalls("containerLocation"));
  daemon.dropConnections();
  EXPECT_EQ(domainAndCode(only(items).error), "NSCocoaErrorDomain 4097");
}

TEST_F(DefaultApplicationContainerTest, AFolderThatCannotBeDescribedAnswersWhy) {
  install("X-Yomber-Containers=org.example.Notes\n");
  const std::string path = makeFolder("somewhere");
  daemon.scriptContent([&](ScriptedContentAnswers& answers) {
    answers.containerLocation = [path](const std::string&, bool) {
      return ScriptedContentAnswers::ContainerLocation{path, nullptr};
    };
  });
  failLookupsWith(NSError::errorWithDomain(NSCocoaErrorDomain, 4354));
  ask();
  const auto answer = only(items);
  EXPECT_EQ(answer.item, nullptr);
  EXPECT_EQ(domainAndCode(answer.error), "NSFileProviderErrorDomain -1003");
}

TEST_F(DefaultApplicationContainerTest, WithoutAHandlerNothingIsAnswered) {
  addContainer("org.example.Notes");
  extension->_defaultApplicationContainerForBundleIdentifier("org.example.Nobody", nullptr);
  install("Name=Notes\n");
  extension->_defaultApplicationContainerForBundleIdentifier("org.example.Notes", nullptr);
  install("X-Yomber-Containers=org.example.Notes\n");
  extension->_defaultApplicationContainerForBundleIdentifier("org.example.Notes", nullptr);
  EXPECT_TRUE(daemon.waitForCalls("containerItem"));
}

}  // namespace
}  // namespace yomber
