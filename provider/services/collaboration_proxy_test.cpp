#include "provider/services/collaboration_proxy.h"

#include <gtest/gtest.h>

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/ostrell/scripted_daemon.h"
#include "platform/rozzel/errors.h"
#include "provider/testing/operations_fixture.h"

namespace yomber {
namespace {

using Options = ScriptedSharingAnswers::Options;
using Text = std::optional<std::string>;

class CollaborationProxyTest : public OperationsTest {
 protected:
  CollaborationProxyTest() { addDocument(5, "five.txt"); }

  std::shared_ptr<QSFileProviderPandrelCollaborationProxy> proxyFor(const std::string& identifier) {
    return QSFileProviderPandrelCollaborationProxy::initWithFileProviderExtension(
        extension, identifier, queue);
  }
  void optionsAre(const Options& options) {
    daemon.scriptSharing([&](ScriptedSharingAnswers& answers) {
      answers.shareOptions = [options](const std::string&) { return options; };
    });
  }

  const std::shared_ptr<NSOperationQueue> queue = std::make_shared<NSOperationQueue>();
  std::shared_ptr<QSFileProviderPandrelCollaborationProxy> proxy = proxyFor("d:5");
  const NSErrorRef refusal = rz_error(RZErrorPermissionFailure, "no");
};

TEST_F(CollaborationProxyTest, AnswersFixedValuesAtOnceAndAsksNobody) {
  ASSERT_TRUE(daemon.waitForCalls("observe"));  // which is how the extension connects
  daemon.forgetCalls();
  int replies = 0;
  proxy->fetchVersionAndCapabilitiesWithCompletionHandler(
      [&](std::uint64_t version, std::uint64_t capabilities, const NSErrorRef& error) {
        EXPECT_EQ(version, 1U);
        EXPECT_EQ(capabilities, 82U);
        EXPECT_EQ(error, nullptr);
        ++replies;
      });
  proxy->fetchFileProviderIdentifierWithCompletionHandler(
      [&](const Text& identifier, const NSErrorRef& error) {
        EXPECT_EQ(identifier, "com.kelvo.Ostrell");
        EXPECT_EQ(error, nullptr);
        ++replies;
      });
  proxy->fetchURLForSharingFileWithCompletionHandler(
      [&](const NSURLRef& url, const NSErrorRef& error) {
        EXPECT_EQ(url, nullptr);
        EXPECT_EQ(error, nullptr);
        ++replies;
      });
  EXPECT_EQ(replies, 3);
  EXPECT_TRUE(daemon.calls().empty());
}

TEST_F(CollaborationProxyTest, ItsProgressesCountNothingAndCallTheirHandler) {
  int calls = 0;
  const auto progress =
      QSFileProviderPandrelCollaborationProxy::_newProgressWithCancellationHandler(
          [&calls] { ++calls; });
  EXPECT_EQ(progress->totalUnitCount(), 0);
  progress->cancel();
  EXPECT_EQ(calls, 1);
}

// ---- The token ---------------------------------------------------------------------------------

struct CollaborationTokenTest : CollaborationProxyTest {
  struct Token {
    Text provider;
    Text first;
    Text second;
    std::optional<NSDate> expiration;
    NSErrorRef error;
  };
  NSProgressRef fetch() {
    return proxy->fetchCollaborationTokenWithCompletionHandler(
        [into = tokens](const Text& provider, const Text& first, const Text& second,
                        const std::optional<NSDate>& expiration, const NSErrorRef& error) {
          into->add({provider, first, second, expiration, error});
        });
  }
  Token onlyToken() {
    const auto all = tokens->wait();
    EXPECT_EQ(all.size(), 1U);
    return all.empty() ? Token{} : all.front();
  }
  void expectNothingBut(const std::string& error) {
    const Token token = onlyToken();
    EXPECT_EQ(token.provider, std::nullopt);
    EXPECT_EQ(token.first, std::nullopt);
    EXPECT_EQ(token.second, std::nullopt);
    EXPECT_EQ(token.expiration, std::nullopt);
    EXPECT_EQ(domainAndCode(token.error), error);
  }
  const std::shared_ptr<Awaited<Token>> tokens = std::make_shared<Awaited<Token>>();
};

TEST_F(CollaborationTokenTest, ComesInTheReverseOrderAndForEver) {
  const auto progress = fetch();
  ASSERT_NE(progress, nullptr);
  EXPECT_EQ(progress->totalUnitCount(), 0);
  const Token token = onlyToken();
  EXPECT_EQ(token.provider, "com.kelvo.Ostrell");
  EXPECT_EQ(token.first, "base");
  EXPECT_EQ(token.second, "share");
  EXPECT_EQ(token.expiration, NSDate::distantFuture());
  EXPECT_EQ(token.error, nullptr);
  EXPECT_EQ(daemon.calls().back(), (ScriptedDaemon::Call{"copyShareToken", {inRoot("five.txt")}}));
}

TEST_F(CollaborationTokenTest, IsNothingButTheErrorWhenItFails) {
  daemon.scriptSharing([this](ScriptedSharingAnswers& answers) {
    answers.copyShareToken = [error = refusal](const std::string&) {
      return ScriptedSharingAnswers::Tokens{.share = "s", .base = "b", .error = error};
    };
  });
  fetch();
  expectNothingBut("RZErrorDomain 12");
}

TEST_F(CollaborationTokenTest, WithoutALocationIsTheOperationsError) {
  proxy = proxyFor("d:77");
  EXPECT_NE(fetch(), nullptr);
  expectNothingBut("NSCocoaErrorDomain 4");
}

TEST_F(CollaborationTokenTest, IsFetchedAlsoWhenNobodyWaitsForIt) {
  EXPECT_NE(proxy->fetchCollaborationTokenWithCompletionHandler({}), nullptr);
  queue->waitUntilAllOperationsAreFinished();
  EXPECT_EQ(daemon.callCount("copyShareToken"), 1U);
}

TEST_F(CollaborationTokenTest, IsCalledOffWithItsProgress) {
  daemon.hold("copyShareToken");
  const auto progress = fetch();
  ASSERT_TRUE(daemon.waitForCalls("copyShareToken"));
  progress->cancel();
  expectNothingBut("NSCocoaErrorDomain 3072");
  EXPECT_TRUE(daemon.waitForCalls("copyShareToken.dropped"));
  daemon.release("copyShareToken");
}

// ---- The latest revision -----------------------------------------------------------------------

TEST_F(CollaborationProxyTest, TheLatestRevisionIsProvidedAlthoughTheFileIsHere) {
  const auto progress = proxy->fetchLatestRevisionWithCompletionHandler(into(errors));
  ASSERT_NE(progress, nullptr);
  EXPECT_EQ(progress->totalUnitCount(), 0);
  EXPECT_EQ(only(errors), nullptr);
  EXPECT_EQ(daemon.calls().back(),
            (ScriptedDaemon::Call{"startProviding", {inRoot("five.txt"), "131072"}}));
  expectLines(
      {"[DEBUG] fetchLatestRevisionWithCompletionHandler: d:5, " + textOf(inRoot("five.txt"))});
}

TEST_F(CollaborationProxyTest, TheLatestRevisionsErrorIsPassedOn) {
  daemon.scriptContent([](ScriptedContentAnswers& answers) {
    answers.startProviding = [](const std::string&, std::uint64_t) {
      return NSError::errorWithDomain(NSCocoaErrorDomain, NSUbiquitousFileUnavailableError);
    };
  });
  proxy->fetchLatestRevisionWithCompletionHandler(into(errors));
  EXPECT_EQ(domainAndCode(only(errors)), "NSCocoaErrorDomain 4354");
}

TEST_F(CollaborationProxyTest, TheLatestRevisionWithoutALocationIsTheOperationsError) {
  proxy = proxyFor("d:77");
  proxy->fetchLatestRevisionWithCompletionHandler(into(errors));
  EXPECT_EQ(domainAndCode(only(errors)), "NSCocoaErrorDomain 4");
  EXPECT_EQ(
      log.count(LogLevel::Debug, "[DEBUG] fetchLatestRevisionWithCompletionHandler: d:77, (null)"),
      1U);
}

TEST_F(CollaborationProxyTest, TheLatestRevisionIsCalledOffWithItsProgress) {
  daemon.hold("startProviding");
  const auto progress = proxy->fetchLatestRevisionWithCompletionHandler(into(errors));
  ASSERT_TRUE(daemon.waitForCalls("startProviding"));
  progress->cancel();
  EXPECT_EQ(domainAndCode(only(errors)), "NSCocoaErrorDomain 3072");
  EXPECT_TRUE(daemon.waitForCalls("startProviding.dropped"));
  daemon.release("startProviding");
}

// ---- Refreshing --------------------------------------------------------------------------------

TEST_F(CollaborationProxyTest, RefreshingAsksForTheItemAndCannotBeCancelled) {
  daemon.hold("refreshSharingState");
  const auto progress = proxy->refreshSharingStateWithCompletionHandler(into(errors));
  ASSERT_NE(progress, nullptr);
  EXPECT_EQ(progress->totalUnitCount(), 0);
  ASSERT_TRUE(daemon.waitForCalls("refreshSharingState"));
  progress->cancel();
  EXPECT_TRUE(errors->values().empty());
  daemon.release("refreshSharingState");
  EXPECT_EQ(only(errors), nullptr);
  EXPECT_EQ(daemon.calls().back(), (ScriptedDaemon::Call{"refreshSharingState", {"d:5"}}));
  expectLines({"[DEBUG] finished refreshing state for item identifier: d:5"});
}

TEST_F(CollaborationProxyTest, ARefreshThatFailsIsLoggedAndPassedOn) {
  daemon.scriptSharing([this](ScriptedSharingAnswers& answers) {
    answers.refreshSharingState = [error = refusal](const std::string&) { return error; };
  });
  proxy->refreshSharingStateWithCompletionHandler(into(errors));
  const NSErrorRef error = only(errors);
  EXPECT_EQ(domainAndCode(error), "RZErrorDomain 12");
  expectLines({"[DEBUG] error refreshing state for item identifier d:5: " + error->description()});
}

TEST_F(CollaborationProxyTest, ARefreshWithoutTheDaemonIsTheConnectionsError) {
  daemon.stop();
  proxy->refreshSharingStateWithCompletionHandler(into(errors));
  EXPECT_NE(only(errors), nullptr);
  EXPECT_EQ(log.countContaining("refreshing state"), 0U);
}

// ---- The state of a shared folder --------------------------------------------------------------

struct SharedFolderTest : CollaborationProxyTest {
  struct State {
    bool isInSharedFolder = false;
    Text folderName;
    NSErrorRef error;
  };
  State state() {
    const auto states = std::make_shared<Awaited<State>>();
    EXPECT_EQ(proxy->fetchFolderSharingStateWithCompletionHandler(
                  [states](bool isIn, const NSErrorRef& error) {
                    states->add({isIn, std::nullopt, error});
                  }),
              nullptr);
    return theOne(*states);
  }
  State info() {
    const auto states = std::make_shared<Awaited<State>>();
    EXPECT_EQ(proxy->fetchSharedFolderInfoWithCompletionHandler(
                  [states](bool isIn, const Text& name, const NSErrorRef& error) {
                    states->add({isIn, name, error});
                  }),
              nullptr);
    return theOne(*states);
  }
  static State theOne(Awaited<State>& states) {
    const auto all = states.wait();
    EXPECT_EQ(all.size(), 1U);
    return all.empty() ? State{} : all.front();
  }
};

TEST_F(SharedFolderTest, IsSharedButNotItselfWhateverItMayWrite) {
  for (const bool mayWrite : {false, true}) {
    const auto expectState = [&](bool isShared, bool isSharedItself, bool expected) {
      optionsAre({.isShared = isShared, .mayWrite = mayWrite, .isSharedItself = isSharedItself});
      EXPECT_EQ(state().isInSharedFolder, expected);
      EXPECT_EQ(info().isInSharedFolder, expected);
    };
    expectState(true, true, false);
    expectState(true, false, true);
    expectState(false, false, false);
    expectState(false, true, false);
  }
}

TEST_F(SharedFolderTest, TheInfoHasTheFoldersName) {
  optionsAre({.isShared = true, .folderName = "Plans"});
  const State found = info();
  EXPECT_EQ(found.folderName, "Plans");
  EXPECT_EQ(found.error, nullptr);
  EXPECT_EQ(daemon.calls().back(), (ScriptedDaemon::Call{"shareOptions", {"d:5"}}));
}

TEST_F(SharedFolderTest, TheDaemonsErrorComesWithWhatItSaid) {
  optionsAre({.isShared = true, .folderName = "Plans", .error = refusal});
  EXPECT_EQ(domainAndCode(state().error), "RZErrorDomain 12");
  const State found = info();
  EXPECT_TRUE(found.isInSharedFolder);
  EXPECT_EQ(found.folderName, "Plans");
  EXPECT_EQ(domainAndCode(found.error), "RZErrorDomain 12");
}

TEST_F(SharedFolderTest, WithoutTheDaemonTheConnectionsErrorIsAllThereIs) {
  daemon.stop();
  const State noState = state();
  EXPECT_FALSE(noState.isInSharedFolder);
  EXPECT_NE(noState.error, nullptr);
  const State noInfo = info();
  EXPECT_FALSE(noInfo.isInSharedFolder);
  EXPECT_EQ(noInfo.folderName, std::nullopt);
  EXPECT_NE(noInfo.error, nullptr);
}

}  // namespace
}  // namespace yomber
