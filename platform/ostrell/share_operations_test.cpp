#include "platform/ostrell/share_operations.h"

#include <gtest/gtest.h>

#include <map>
#include <memory>
#include <string>
#include <tuple>
#include <vector>

#include "platform/ostrell/awaited.h"
#include "platform/ostrell/daemon_connection.h"
#include "platform/ostrell/errors.h"
#include "platform/ostrell/scripted_daemon.h"
#include "platform/ostrell/test_short_patience.h"
#include "platform/rozzel/errors.h"

namespace yomber {
namespace {

using Call = ScriptedDaemon::Call;

struct Answer {
  RZShareRef share = {};
  NSURLRef url = {};
  std::optional<std::string> first = {};
  std::optional<std::string> second = {};
  NSErrorRef error = {};
};

class ShareOperationsTest : public testing::Test {
 protected:
  using Answers = std::shared_ptr<Awaited<Answer>>;

  std::shared_ptr<QSShareCopyOperation> copyOperation(const NSURLRef& of) {
    auto operation = QSShareCopyOperation::initWithURL(of);
    operation->setRootShareCopyCompletionBlock(
        [into = answers](const RZShareRef& share, const NSURLRef& found, const NSErrorRef& error) {
          into->add({.share = share, .url = found, .error = error});
        });
    return operation;
  }
  std::shared_ptr<QSShareCopyShareURLOperation> linkOperation() {
    auto operation = QSShareCopyShareURLOperation::initWithFileURL(url, "text/plain");
    operation->setCopyShareURLCompletionBlock(
        [into = answers](const NSURLRef& link, const NSErrorRef& error) {
          into->add({.url = link, .error = error});
        });
    return operation;
  }
  std::shared_ptr<QSShareSaveOperation> saveOperation(const RZShareRef& share) {
    auto operation = QSShareSaveOperation::initWithShare(share);
    operation->setShareSaveCompletionBlock(
        [into = answers](const RZShareRef& saved, const NSErrorRef& error) {
          into->add({.share = saved, .error = error});
        });
    return operation;
  }
  std::shared_ptr<QSShareDestroyOperation> destroyOperation(const RZShareRef& share) {
    auto operation = QSShareDestroyOperation::initWithShare(share);
    operation->setShareDestroyCompletionBlock(
        [into = answers](const NSErrorRef& error) { into->add({.error = error}); });
    return operation;
  }
  std::shared_ptr<QSSharingCopyShareTokenOperation> tokenOperation() {
    auto operation = QSSharingCopyShareTokenOperation::initWithURL(url);
    operation->setShareAndBaseTokenCompletionBlock(
        [into = answers](const auto& share, const auto& base, const NSErrorRef& error) {
          into->add({.first = share, .second = base, .error = error});
        });
    return operation;
  }
  std::shared_ptr<QSShareAcceptOperation> acceptOperation(const std::string& link) {
    auto operation = QSShareAcceptOperation::initWithShareURL(NSURL::URLWithString(link));
    operation->setShareAcceptCompletionBlock(
        [into = answers](const auto& identifier, const NSErrorRef& error) {
          into->add({.first = identifier, .error = error});
        });
    return operation;
  }

  /// One of each kind, by what it asks the daemon.
  std::map<std::string, NSOperationRef> oneOfEach() {
    return {{"copyShare", copyOperation(url)},
            {"copyShareURL", linkOperation()},
            {"saveShare", saveOperation(scriptedShare("a"))},
            {"destroyShare", destroyOperation(scriptedShare("a"))},
            {"copyShareToken", tokenOperation()},
            {"acceptShare", acceptOperation("yomber-share:00ff")}};
  }

  Answer only() {
    const auto all = answers->wait();
    EXPECT_EQ(all.size(), 1U);
    return all.empty() ? Answer{} : all.front();
  }
  Answer run(const NSOperationRef& operation) {
    queue.addOperation(operation);
    Answer answer = only();
    operation->waitUntilFinished();
    return answer;
  }
  Call lastCall() const { return daemon.calls().back(); }

  ScriptedDaemon daemon;
  const NSURLRef url = NSURL::fileURLWithPath(daemon.root() + "/five.txt");
  const Answers answers = std::make_shared<Awaited<Answer>>();
  const NSErrorRef refusal = NSError::errorWithDomain("RZErrorDomain", 12);
  NSOperationQueue queue;
};

TEST_F(ShareOperationsTest, CopyingBringsTheShareOfTheItem) {
  daemon.scriptSharing([](ScriptedSharingAnswers& script) {
    script.copyShare = [](const std::string&) {
      return ScriptedSharingAnswers::Share{.share = scriptedShare("five.txt")};
    };
  });
  const Answer answer = run(copyOperation(url));
  ASSERT_NE(answer.share, nullptr);
  EXPECT_EQ(answer.share->title(), "five.txt");
  EXPECT_TRUE(answer.share->isKnownToServer());
  EXPECT_EQ(answer.url, nullptr);
  EXPECT_EQ(answer.error, nullptr);
  EXPECT_EQ(lastCall(), (Call{"copyShare", {url->path()}}));
}

TEST_F(ShareOperationsTest, CopyingSaysWhichFolderIsShared) {
  daemon.scriptSharing([this](ScriptedSharingAnswers& script) {
    script.copyShare = [root = daemon.root()](const std::string&) {
      return ScriptedSharingAnswers::Share{.share = scriptedShare("Plans", "1", RZShareTypeFolder),
                                           .rootPath = root + "/Plans"};
    };
  });
  const Answer answer = run(copyOperation(url));
  ASSERT_NE(answer.url, nullptr);
  EXPECT_EQ(answer.url->path(), daemon.root() + "/Plans");
}

TEST_F(ShareOperationsTest, CopyingWhatIsNotSharedIsCode20) {
  const Answer answer = run(copyOperation(url));
  EXPECT_EQ(answer.share, nullptr);
  EXPECT_TRUE(qs_isOstrellErrorCode(answer.error, QSOstrellErrorNotShared));
}

TEST_F(ShareOperationsTest, WithoutALocationNobodyIsAsked) {
  const Answer answer = run(copyOperation(nullptr));
  ASSERT_NE(answer.error, nullptr);
  EXPECT_TRUE(answer.error->is(NSCocoaErrorDomain, NSFileNoSuchFileError));
  EXPECT_EQ(daemon.callCount("copyShare"), 0U);
}

TEST_F(ShareOperationsTest, WithoutAShareNobodyIsAsked) {
  const Answer answer = run(saveOperation(nullptr));
  EXPECT_TRUE(qs_isOstrellErrorCode(answer.error, QSOstrellErrorInvalidParameter));
  EXPECT_EQ(daemon.callCount("saveShare"), 0U);
}

TEST_F(ShareOperationsTest, TheLinkComesAsAnAddress) {
  daemon.scriptSharing([](ScriptedSharingAnswers& script) {
    script.copyShareURL = [](const std::string&, const std::string&) {
      return ScriptedSharingAnswers::Text{.text = "yomber-share:00ff"};
    };
  });
  const Answer answer = run(linkOperation());
  ASSERT_NE(answer.url, nullptr);
  EXPECT_EQ(answer.url->absoluteString(), "yomber-share:00ff");
  EXPECT_EQ(lastCall(), (Call{"copyShareURL", {url->path(), "text/plain"}}));
}

TEST_F(ShareOperationsTest, ALinkThatIsNoneIsAnErrorOfTheReply) {
  daemon.scriptSharing([](ScriptedSharingAnswers& script) {
    script.copyShareURL = [](const std::string&, const std::string&) {
      return ScriptedSharingAnswers::Text{.text = "file:///etc/passwd"};
    };
  });
  const Answer answer = run(linkOperation());
  EXPECT_EQ(answer.url, nullptr);
  ASSERT_NE(answer.error, nullptr);
  EXPECT_TRUE(answer.error->is(NSCocoaErrorDomain, NSXPCConnectionReplyInvalid));
}

TEST_F(ShareOperationsTest, SavingSendsTheShareAndBringsItAsItIsSaved) {
  const Answer answer = run(saveOperation(scriptedShare("five.txt", "")));
  ASSERT_NE(answer.share, nullptr);
  EXPECT_EQ(answer.share->changeTag(), "1");
  EXPECT_EQ(lastCall(), (Call{"saveShare", {"five.txt", ""}}));
}

TEST_F(ShareOperationsTest, SavingBringsTheStoresRefusal) {
  daemon.scriptSharing([this](ScriptedSharingAnswers& script) {
    script.saveShare = [error = refusal](const RZShareRef&) {
      return ScriptedSharingAnswers::Share{.share = {}, .error = error};
    };
  });
  const Answer answer = run(saveOperation(scriptedShare("five.txt")));
  EXPECT_EQ(answer.share, nullptr);
  ASSERT_NE(answer.error, nullptr);
  EXPECT_TRUE(answer.error->is("RZErrorDomain", 12));
}

TEST_F(ShareOperationsTest, AShareThatIsNoneIsAnErrorOfTheReply) {
  daemon.scriptSharing([](ScriptedSharingAnswers& script) {
    script.saveShare = [](const RZShareRef&) { return ScriptedSharingAnswers::Share(); };
  });
  const Answer answer = run(saveOperation(scriptedShare("five.txt")));
  ASSERT_NE(answer.error, nullptr);
  EXPECT_TRUE(answer.error->is(NSCocoaErrorDomain, NSXPCConnectionReplyInvalid));
}

TEST_F(ShareOperationsTest, ACopyThatBringsNeitherAShareNorAReasonIsAnErrorOfTheReply) {
  daemon.scriptSharing([](ScriptedSharingAnswers& script) {
    script.copyShare = [](const std::string&) { return ScriptedSharingAnswers::Share(); };
  });
  const Answer answer = run(copyOperation(url));
  EXPECT_EQ(answer.share, nullptr);
  EXPECT_EQ(answer.url, nullptr);
  ASSERT_NE(answer.error, nullptr) << "nobody is to take it for an item that is not shared";
  EXPECT_TRUE(answer.error->is(NSCocoaErrorDomain, NSXPCConnectionReplyInvalid));
}

TEST_F(ShareOperationsTest, AFolderWithoutALocationIsAnErrorOfTheReply) {
  daemon.scriptSharing([](ScriptedSharingAnswers& script) {
    script.copyShare = [](const std::string&) {
      return ScriptedSharingAnswers::Share{.share = scriptedShare("Plans"),
                                           .rootPath = "../../etc"};
    };
  });
  const Answer answer = run(copyOperation(url));
  EXPECT_EQ(answer.share, nullptr);
  EXPECT_EQ(answer.url, nullptr);
  ASSERT_NE(answer.error, nullptr);
  EXPECT_TRUE(answer.error->is(NSCocoaErrorDomain, NSXPCConnectionReplyInvalid));
}

TEST_F(ShareOperationsTest, AnIdentifierThatIsNoneIsAnErrorOfTheReply) {
  daemon.scriptSharing([](ScriptedSharingAnswers& script) {
    script.acceptShare = [](const std::string&) { return ScriptedSharingAnswers::Text(); };
  });
  const Answer answer = run(acceptOperation("yomber-share:00ff"));
  EXPECT_EQ(answer.first, std::nullopt);
  ASSERT_NE(answer.error, nullptr);
  EXPECT_TRUE(answer.error->is(NSCocoaErrorDomain, NSXPCConnectionReplyInvalid));
}

TEST_F(ShareOperationsTest, ANewShareThatIsNoneIsAnErrorOfTheReply) {
  daemon.scriptSharing([](ScriptedSharingAnswers& script) {
    script.newShare = [](const std::string&) { return ScriptedSharingAnswers::Share(); };
  });
  NSErrorRef error;
  EXPECT_EQ(QSSharingCreateShareForItemAtURL(url, &error), nullptr);
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSXPCConnectionReplyInvalid));
}

TEST_F(ShareOperationsTest, DestroyingSendsTheShare) {
  EXPECT_EQ(run(destroyOperation(scriptedShare("five.txt", "7"))).error, nullptr);
  EXPECT_EQ(lastCall(), (Call{"destroyShare", {"five.txt", "7"}}));
}

TEST_F(ShareOperationsTest, TokensComeInTheirOrder) {
  const Answer answer = run(tokenOperation());
  EXPECT_EQ(answer.first, "share");
  EXPECT_EQ(answer.second, "base");
  EXPECT_EQ(answer.error, nullptr);
}

TEST_F(ShareOperationsTest, NoTokensComeWithAnError) {
  daemon.scriptSharing([this](ScriptedSharingAnswers& script) {
    script.copyShareToken = [error = refusal](const std::string&) {
      return ScriptedSharingAnswers::Tokens{.share = "s", .base = "b", .error = error};
    };
  });
  const Answer answer = run(tokenOperation());
  EXPECT_EQ(answer.first, std::nullopt);
  EXPECT_EQ(answer.second, std::nullopt);
  EXPECT_NE(answer.error, nullptr);
}

TEST_F(ShareOperationsTest, AcceptingSendsTheLinkAndBringsTheIdentifier) {
  const Answer answer = run(acceptOperation("yomber-share:00ff"));
  EXPECT_EQ(answer.first, "d:5");
  EXPECT_EQ(lastCall(), (Call{"acceptShare", {"yomber-share:00ff"}}));
}

TEST_F(ShareOperationsTest, CancellingDropsTheCallAndEndsItOnce) {
  std::size_t ended = 0;
  for (const auto& [method, operation] : oneOfEach()) {
    daemon.hold(method);
    queue.addOperation(operation);
    ASSERT_TRUE(daemon.waitForCalls(method)) << method;
    operation->cancel();
    EXPECT_TRUE(daemon.waitForCalls(method + ".dropped")) << method;
    operation->cancel();
    daemon.release(method);
    operation->waitUntilFinished();
    ASSERT_EQ(answers->values().size(), ++ended) << method;
    const auto error = answers->values().back().error;
    ASSERT_NE(error, nullptr) << method;
    EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSUserCancelledError)) << method;
  }
}

TEST_F(ShareOperationsTest, CancelledBeforeItStartsItNeverAsksAndEndsOnce) {
  queue.setSuspended(true);
  const auto operation = copyOperation(url);
  queue.addOperation(operation);
  operation->cancel();
  queue.setSuspended(false);
  queue.waitUntilAllOperationsAreFinished();
  const Answer answer = only();
  ASSERT_NE(answer.error, nullptr);
  EXPECT_TRUE(answer.error->is(NSCocoaErrorDomain, NSUserCancelledError));
  EXPECT_EQ(daemon.callCount("copyShare"), 0U);
}

TEST_F(ShareOperationsTest, LosingTheDaemonEndsItWithCode4) {
  daemon.hold("saveShare");
  queue.addOperation(saveOperation(scriptedShare("five.txt")));
  ASSERT_TRUE(daemon.waitForCalls("saveShare"));
  daemon.dropConnections();
  const Answer answer = only();
  EXPECT_TRUE(qs_isOstrellErrorCode(answer.error, QSOstrellErrorConnectionLost));
}

// ---- A daemon that is alive but stuck ----------------------------------------------------------

/// The time limit is read when the daemon's link is made.
class ShareOperationsOfAStuckDaemonTest : private ShortPatience, public ShareOperationsTest {};

TEST_F(ShareOperationsOfAStuckDaemonTest, AnsweringOtherQuestionsItMayTakeItsTime) {
  const auto all = oneOfEach();
  for (const auto& [method, operation] : all) {
    daemon.hold(method);
    queue.addOperation(operation);
    ASSERT_TRUE(daemon.waitForCalls(method)) << method;
  }
  daemon.forgetCalls();
  ASSERT_TRUE(daemon.waitForCalls("describe", 2 * all.size()));
  EXPECT_TRUE(answers->values().empty());
  for (const auto& [method, operation] : all) daemon.release(method);
  for (const Answer& answer : answers->wait(all.size()))
    EXPECT_TRUE(!answer.error || qs_isOstrellErrorCode(answer.error, QSOstrellErrorNotShared));
}

TEST_F(ShareOperationsOfAStuckDaemonTest, AnsweringNothingItIsGivenUpOnce) {
  const auto all = oneOfEach();
  for (const auto& [method, operation] : all) {
    daemon.hold(method);
    queue.addOperation(operation);
    ASSERT_TRUE(daemon.waitForCalls(method)) << method;
  }
  daemon.hold("*");
  ASSERT_EQ(answers->wait(all.size()).size(), all.size());
  for (const auto& [method, operation] : all)
    EXPECT_TRUE(daemon.waitForCalls(method + ".dropped")) << method;
  daemon.release("*");
  queue.waitUntilAllOperationsAreFinished();
  ASSERT_EQ(answers->values().size(), all.size());
  for (const Answer& answer : answers->values()) {
    ASSERT_NE(answer.error, nullptr);
    EXPECT_TRUE(answer.error->is(NSCocoaErrorDomain, NSXPCConnectionTimedOut));
    EXPECT_TRUE(answer.error->localizedDescription().contains("yomber down"));
  }
}

// ------------------------------------------------------------------------------------------------

TEST_F(ShareOperationsTest, ANewShareIsMadeForTheLocation) {
  NSErrorRef error;
  const RZShareRef share = QSSharingCreateShareForItemAtURL(url, &error);
  ASSERT_NE(share, nullptr);
  EXPECT_EQ(share->title(), "five.txt");
  EXPECT_FALSE(share->isKnownToServer());
  EXPECT_EQ(error, nullptr);
  EXPECT_EQ(QSSharingCreateShareForItemAtURL(nullptr, &error), nullptr);
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSFileNoSuchFileError));
}

TEST_F(ShareOperationsTest, TheDaemonSaysWhetherAFolderCanBeShared) {
  const auto ask = [] {
    const auto proxy = QSDaemonConnection::defaultConnection().newSyncProxy();
    proxy->checkIfItemIsShareableWithInode(7, [&](bool shareable, const NSErrorRef& error) {
      proxy->setBoolResult(shareable, error);
    });
    return std::pair(proxy->boolResult(), proxy->error());
  };
  EXPECT_EQ(ask(), (std::pair<bool, NSErrorRef>(true, nullptr)));
  EXPECT_EQ(lastCall(), (Call{"checkIfShareable", {"7"}}));
  daemon.scriptSharing([this](ScriptedSharingAnswers& script) {
    script.checkIfShareable = [error = refusal](std::uint64_t) {
      return ScriptedSharingAnswers::Shareable{.isShareable = false, .error = error};
    };
  });
  EXPECT_FALSE(ask().first);
  EXPECT_NE(ask().second, nullptr);
  daemon.stop();
  EXPECT_FALSE(ask().first);
  EXPECT_NE(ask().second, nullptr);
}

TEST_F(ShareOperationsTest, ShareOptionsComeAsTheyAreSent) {
  daemon.scriptSharing([](ScriptedSharingAnswers& script) {
    script.shareOptions = [](const std::string&) {
      return ScriptedSharingAnswers::Options{
          .isShared = true, .mayWrite = false, .isSharedItself = true, .folderName = "Plans"};
    };
  });
  using Options = std::tuple<bool, bool, bool, std::optional<std::string>>;
  const auto options = std::make_shared<Awaited<Options>>();
  const auto proxy = QSDaemonConnection::defaultConnection().remoteObjectProxyWithErrorHandler({});
  proxy->getShareOptionsOfItemIdentifier(
      "d:5", [options](bool shared, bool writes, bool itself, const auto& name, const NSErrorRef&) {
        options->add({shared, writes, itself, name});
      });
  EXPECT_EQ(options->wait(), (std::vector<Options>{{true, false, true, "Plans"}}));
  EXPECT_EQ(lastCall(), (Call{"shareOptions", {"d:5"}}));
}

TEST_F(ShareOperationsTest, SharesOfOthersComeWithoutThoseThatAreNone) {
  daemon.scriptSharing([](ScriptedSharingAnswers& script) {
    script.sharesWithMe = [] {
      return std::vector<RZShareRef>{scriptedShare("a"), nullptr, scriptedShare("b")};
    };
  });
  std::vector<std::string> titles;
  QSDaemonConnection::defaultConnection().newSyncProxy()->sharesWithMeWithReply(
      [&](const std::vector<RZShareRef>& shares, const NSErrorRef&) {
        for (const auto& share : shares) titles.push_back(share->title());
      });
  EXPECT_EQ(titles, (std::vector<std::string>{"a", "b"}));
}

TEST(ShareErrorsTest, AreFoundBelowOthersAndAmongRecords) {
  const auto isUnknown = [](const NSErrorRef& error) {
    return qsc_isRozzelUnknownItemError(error);
  };
  const NSErrorRef unknown = rz_error(RZErrorUnknownItem, "gone");
  const NSErrorRef other = rz_error(RZErrorPermissionFailure, "no");
  EXPECT_TRUE(qsc_checkErrorsFromRozzel(unknown, isUnknown));
  EXPECT_FALSE(qsc_checkErrorsFromRozzel(other, isUnknown));
  EXPECT_FALSE(qsc_checkErrorsFromRozzel(nullptr, isUnknown));
  EXPECT_TRUE(qsc_checkErrorsFromRozzel(
      NSError::errorWithDomain(QSOstrellErrorDomain, 4, {{NSUnderlyingErrorKey, unknown}}),
      isUnknown));
  const RZRecordZoneID zone("zone");
  const NSErrorRef batch =
      rz_batchError({{RZRecordID("a", zone), other}, {RZRecordID("b", zone), unknown}});
  EXPECT_TRUE(qsc_checkErrorsFromRozzel(batch, isUnknown));
}

TEST(ShareErrorsTest, SayWhatTheyAre) {
  const NSErrorRef error = qs_errorWithPOSIXCode(QSPOSIXErrorNotSupported);
  EXPECT_TRUE(error->is(NSPOSIXErrorDomain, 45));
  EXPECT_NE(error->localizedDescription().find("not supported"), std::string::npos);
  EXPECT_TRUE(qs_isOstrellErrorCode(qsc_errorLoggedOut(), QSOstrellErrorLoggedOut));
  EXPECT_FALSE(qs_isOstrellErrorCode(nullptr, 0));
}

}  // namespace
}  // namespace yomber
