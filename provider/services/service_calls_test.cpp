// Calls to the two services over a connection: called off at every stage, overtaken by the end of
// the connection, and left without the daemon.

#include <gtest/gtest.h>

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <tuple>
#include <vector>

#include "platform/ostrell/awaited.h"
#include "platform/rozzel/errors.h"
#include "provider/testing/service_connections_fixture.h"

namespace yomber {
namespace {

using Texts = std::vector<std::string>;
using Share = ScriptedSharingAnswers::Share;

/// One call of a service that asks the daemon, and the question it then waits for.
template <typename Protocol>
struct DaemonCall {
  std::string name;
  std::string question;
  std::function<NSProgressRef(Protocol& service, const ErrorAnswers& replies)> begin;
};

/// A reply whose last value is the error.
auto lastInto(const ErrorAnswers& replies) {
  return [replies](const auto&... values) {
    replies->add(std::get<sizeof...(values) - 1>(std::tie(values...)));
  };
}

class ServiceCallsTest : public ServiceConnectionsTest {
 protected:
  using Sharing = DaemonCall<QSSharingServiceV1>;
  using Collaboration = DaemonCall<QSFileProviderPandrelCollaboration>;

  static std::vector<Sharing> sharingCalls() {
    return {{"fetching the share", "copyShare",
             [](auto& service, const ErrorAnswers& replies) {
               return service.fetchShareWithCompletion(lastInto(replies));
             }},
            {"fetching the participants", "copyShare",
             [](auto& service, const ErrorAnswers& replies) {
               return service.fetchParticipantListAndPublicPermission(lastInto(replies));
             }},
            {"fetching the link", "copyShareURL",
             [](auto& service, const ErrorAnswers& replies) {
               return service.fetchShareURLWithCompletion(lastInto(replies));
             }},
            {"saving", "saveShare",
             [](auto& service, const ErrorAnswers& replies) {
               return service.saveShare(scriptedShare("five.txt"), lastInto(replies));
             }},
            {"unsharing, which fetches", "copyShare",
             [](auto& service, const ErrorAnswers& replies) {
               return service.unshareWithCompletion(lastInto(replies));
             }},
            {"unsharing, which destroys", "destroyShare",
             [](auto& service, const ErrorAnswers& replies) {
               return service.unshareWithCompletion(lastInto(replies));
             }}};
  }
  static std::vector<Collaboration> collaborationCalls() {
    return {{"fetching the token", "copyShareToken",
             [](auto& service, const ErrorAnswers& replies) {
               return service.fetchCollaborationTokenWithCompletionHandler(lastInto(replies));
             }},
            {"fetching the latest revision", "startProviding",
             [](auto& service, const ErrorAnswers& replies) {
               return service.fetchLatestRevisionWithCompletionHandler(lastInto(replies));
             }}};
  }

  /// Runs `test(client, service, call, failures)` for each call that can be called off, with a
  /// connection of its own.
  template <typename Test>
  void forEachCall(const Test& test) {
    itemIsShared();
    for (const auto& call : sharingCalls()) {
      SCOPED_TRACE(call.name);
      run<QSSharingServiceV1>(connectToSharing(), call, test);
    }
    for (const auto& call : collaborationCalls()) {
      SCOPED_TRACE(call.name);
      run<QSFileProviderPandrelCollaboration>(connectToCollaboration(), call, test);
    }
  }
  void itemIsShared() {
    daemon.scriptSharing([](ScriptedSharingAnswers& answers) {
      answers.copyShare = [](const std::string&) {
        return Share{.share = scriptedShare("five.txt")};
      };
      answers.copyShareURL = [](const std::string&, const std::string&) {
        return ScriptedSharingAnswers::Text{.text = "yomber-share:00ff"};
      };
    });
  }
  /// From now on the daemon refuses that.
  void refuse(const std::string& question) {
    const NSErrorRef refusal = rz_error(RZErrorPermissionFailure, "no");
    daemon.scriptSharing([&](ScriptedSharingAnswers& answers) {
      const auto noShare = [refusal](const auto&) { return Share{.share = {}, .error = refusal}; };
      if (question == "copyShare") answers.copyShare = noShare;
      if (question == "saveShare") answers.saveShare = noShare;
      if (question == "destroyShare")
        answers.destroyShare = [refusal](const auto&) { return refusal; };
      if (question == "copyShareURL")
        answers.copyShareURL = [refusal](const auto&, const auto&) {
          return ScriptedSharingAnswers::Text{.text = {}, .error = refusal};
        };
      if (question == "copyShareToken")
        answers.copyShareToken = [refusal](const auto&) {
          return ScriptedSharingAnswers::Tokens{.share = "s", .base = "b", .error = refusal};
        };
    });
    daemon.scriptContent([&](ScriptedContentAnswers& answers) {
      if (question == "startProviding")
        answers.startProviding = [refusal](const auto&, auto) { return refusal; };
    });
  }
  /// The connection still answers: whatever came before on its queue is over then.
  void expectAnswers(const NSXPCConnectionRef& client, const QSSharingServiceV1&) {
    EXPECT_EQ(isShared(client), nullptr);
  }
  void expectAnswers(const NSXPCConnectionRef& client, const QSFileProviderPandrelCollaboration&) {
    EXPECT_EQ(fetchesAVersion(client), nullptr);
  }
  /// A new client of that service is answered.
  void expectWorks(const QSSharingServiceV1& service) {
    expectAnswers(connectToSharing(), service);
  }
  void expectWorks(const QSFileProviderPandrelCollaboration& service) {
    expectAnswers(connectToCollaboration(), service);
  }
  static std::string invalidationLine(const QSSharingServiceV1&) {
    return "[DEBUG] sharing service source connection invalidated";
  }
  static std::string invalidationLine(const QSFileProviderPandrelCollaboration&) {
    return "[DEBUG] collaboration service source connection invalidated";
  }

 private:
  template <typename Protocol, typename Test>
  void run(const NSXPCConnectionRef& client, const DaemonCall<Protocol>& call, const Test& test) {
    daemon.forgetCalls();
    const auto failures = std::make_shared<Awaited<NSErrorRef>>();
    test(client, *client->remoteObjectProxyWithErrorHandler<Protocol>(into(failures)), call,
         failures);
    queue->waitUntilAllOperationsAreFinished();
  }
};

// ---- Called off --------------------------------------------------------------------------------

TEST_F(ServiceCallsTest, WhatTheDaemonIsAskedIsGivenUp) {
  forEachCall([&](const auto& client, auto& service, const auto& call, const auto& failures) {
    const auto replies = std::make_shared<Awaited<NSErrorRef>>();
    daemon.hold(call.question);
    const auto progress = call.begin(service, replies);
    ASSERT_TRUE(daemon.waitForCalls(call.question));
    progress->cancel();
    EXPECT_EQ(domainAndCode(only(replies)), "NSCocoaErrorDomain 3072");
    EXPECT_TRUE(daemon.waitForCalls(call.question + ".dropped"));
    daemon.release(call.question);
    expectAnswers(client, service);
    EXPECT_EQ(replies->values().size(), 1U) << "the daemon's answer came too late";
    EXPECT_TRUE(failures->values().empty());
  });
}

TEST_F(ServiceCallsTest, WhatWasNotDeliveredYetIsGivenUpWhenItIs) {
  forEachCall([&](const auto& client, auto& service, const auto& call, const auto& failures) {
    const auto replies = std::make_shared<Awaited<NSErrorRef>>();
    daemon.hold(call.question);
    call.begin(service, replies)->cancel();
    EXPECT_EQ(domainAndCode(only(replies)), "NSCocoaErrorDomain 3072");
    daemon.release(call.question);
    expectAnswers(client, service);
    EXPECT_EQ(replies->values().size(), 1U);
    EXPECT_TRUE(failures->values().empty());
  });
}

TEST_F(ServiceCallsTest, WhatWasAnsweredStaysAnswered) {
  forEachCall([&](const auto& client, auto& service, const auto& call, const auto& failures) {
    const auto replies = std::make_shared<Awaited<NSErrorRef>>();
    const auto progress = call.begin(service, replies);
    EXPECT_EQ(only(replies), nullptr);
    progress->cancel();
    expectAnswers(client, service);
    EXPECT_EQ(replies->values().size(), 1U) << "one reply and no other";
    EXPECT_TRUE(failures->values().empty());
    EXPECT_EQ(daemon.callCount(call.question), 1U);
    EXPECT_EQ(daemon.callCount(call.question + ".dropped"), 0U);
  });
}

// ---- Without the client ------------------------------------------------------------------------

TEST_F(ServiceCallsTest, GoOnWhenTheirClientIsGoneAndTheirRepliesGoNowhere) {
  forEachCall([&](const auto& client, auto& service, const auto& call, const auto& failures) {
    log.forget();
    const auto replies = std::make_shared<Awaited<NSErrorRef>>();
    daemon.hold(call.question);
    const auto progress = call.begin(service, replies);
    ASSERT_TRUE(daemon.waitForCalls(call.question));
    client->invalidate();
    EXPECT_EQ(domainAndCode(only(failures)), "NSCocoaErrorDomain 4099");
    ASSERT_TRUE(log.waitFor(LogLevel::Debug, invalidationLine(service)));
    daemon.release(call.question);
    queue->waitUntilAllOperationsAreFinished();
    EXPECT_EQ(daemon.callCount(call.question + ".dropped"), 0U);
    EXPECT_TRUE(replies->values().empty());
    EXPECT_EQ(failures->values().size(), 1U);
    expectWorks(service);
  });
}

// ---- A fresh share -----------------------------------------------------------------------------

/// Fetching the share of what is not shared, at the moment when the daemon is asked for a new one.
class FreshShareTest : public ServiceCallsTest {
 protected:
  FreshShareTest() {
    daemon.hold("newShare");
    progress_ =
        client_->remoteObjectProxyWithErrorHandler<QSSharingServiceV1>(into(failures_))
            ->fetchShareWithCompletion(
                [replies = replies_](const RZShareRef& share, const NSErrorRef& error) {
                  replies->add((share ? share->title() : "nothing") + " " + domainAndCode(error));
                });
    EXPECT_TRUE(daemon.waitForCalls("newShare"));
  }
  /// What the fetch is answered, once.
  std::string outcome() {
    const Texts all = replies_->wait();
    queue->waitUntilAllOperationsAreFinished();
    EXPECT_EQ(isShared(client_), nullptr) << "the connection stays";
    EXPECT_EQ(replies_->values().size(), 1U);
    EXPECT_TRUE(failures_->values().empty());
    return all.empty() ? "nothing" : all.front();
  }

  NSProgressRef progress_;

 private:
  const NSXPCConnectionRef client_ = connectToSharing();
  const std::shared_ptr<Awaited<std::string>> replies_ = std::make_shared<Awaited<std::string>>();
  const ErrorAnswers failures_ = std::make_shared<Awaited<NSErrorRef>>();
};

TEST_F(FreshShareTest, IsAnsweredThoughItsFetchIsCalledOffTooLate) {
  ASSERT_EQ(queue->operations().size(), 1U);
  const auto fetch = queue->operations().front();
  progress_->cancel();
  EXPECT_TRUE(daemon.waitUntil([&] { return fetch->isCancelled(); }));
  daemon.release("newShare");
  EXPECT_EQ(outcome(), "five.txt nil");
}

TEST_F(FreshShareTest, IsTheConnectionsErrorWhenTheDaemonGoes) {
  daemon.stop();
  daemon.start();
  EXPECT_EQ(outcome(), "nothing NSCocoaErrorDomain 4097");
}

// ---- Without the daemon ------------------------------------------------------------------------

TEST_F(ServiceCallsTest, AreAnsweredOnceThatTheDaemonWasLostAndWorkWithTheNext) {
  forEachCall([&](const auto& client, auto& service, const auto& call, const auto& failures) {
    const auto replies = std::make_shared<Awaited<NSErrorRef>>();
    daemon.hold(call.question);
    const auto progress = call.begin(service, replies);
    ASSERT_TRUE(daemon.waitForCalls(call.question));
    daemon.stop();
    EXPECT_EQ(domainAndCode(only(replies)), "QSOstrellErrorDomain 4");
    progress->cancel();
    daemon.release(call.question);
    daemon.start();
    expectAnswers(client, service);
    EXPECT_EQ(replies->values().size(), 1U) << "being called off comes too late";
    EXPECT_TRUE(failures->values().empty());
    const auto again = std::make_shared<Awaited<NSErrorRef>>();
    (void)call.begin(service, again);
    EXPECT_EQ(only(again), nullptr);
  });
}

TEST_F(ServiceCallsTest, AreAnsweredOnceWithTheDaemonsRefusal) {
  forEachCall([&](const auto& client, auto& service, const auto& call, const auto& failures) {
    const auto replies = std::make_shared<Awaited<NSErrorRef>>();
    refuse(call.question);
    (void)call.begin(service, replies);
    EXPECT_EQ(domainAndCode(only(replies)), "RZErrorDomain 12");
    expectAnswers(client, service);
    EXPECT_EQ(replies->values().size(), 1U);
    EXPECT_TRUE(failures->values().empty());
    EXPECT_EQ(daemon.callCount(call.question), 1U);
    itemIsShared();
  });
}

/// What the collaboration service passes to the daemon and does not keep.
class PassedCallsTest : public ServiceConnectionsTest {
 protected:
  using Protocol = QSFileProviderPandrelCollaboration;
  using Ends = std::shared_ptr<Awaited<std::string>>;

  struct PassedCall {
    std::string question;
    std::function<NSProgressRef(Protocol& service, const Ends& ends)> begin;
  };

  /// What came of a call: the reply, or the failure of the call itself. Once the daemon has been
  /// asked, `happen` is called with the call's connection and progress.
  std::string endOf(
      const PassedCall& call,
      const std::function<void(const NSXPCConnectionRef& client, NSProgress& progress)>& happen) {
    const auto client = connectToCollaboration();
    const auto ends = std::make_shared<Awaited<std::string>>();
    const auto service = client->remoteObjectProxyWithErrorHandler<Protocol>(
        [ends](const NSErrorRef& error) { ends->add("not answered: " + domainAndCode(error)); });
    daemon.forgetCalls();
    daemon.hold(call.question);
    const auto progress = call.begin(*service, ends);
    EXPECT_TRUE(daemon.waitForCalls(call.question));
    EXPECT_TRUE(ends->values().empty());
    happen(client, *progress);
    const Texts all = ends->wait();
    EXPECT_EQ(fetchesAVersion(client), nullptr) << "the connection stays";
    EXPECT_EQ(ends->values().size(), 1U);
    return all.empty() ? "nothing" : all.front();
  }
  std::string endWithoutDaemon(const PassedCall& call) {
    return endOf(call, [this](const auto&, NSProgress&) { daemon.stop(); });
  }
  std::string endWhenAnswered(const PassedCall& call) {
    return endOf(call, [&](const auto&, NSProgress&) { daemon.release(call.question); });
  }
  std::string endWhenCalledOff(const PassedCall& call) {
    return endOf(call, [&](const auto& client, NSProgress& progress) {
      progress.cancel();
      EXPECT_EQ(fetchesAVersion(client), nullptr) << "so that it has arrived there";
      daemon.release(call.question);
    });
  }
  void optionsAre(const ScriptedSharingAnswers::Options& options) {
    daemon.scriptSharing([&](ScriptedSharingAnswers& answers) {
      answers.shareOptions = [options](const std::string&) { return options; };
    });
  }

  const PassedCall folderState{"shareOptions", [](Protocol& service, const Ends& ends) {
                                 return service.fetchFolderSharingStateWithCompletionHandler(
                                     [ends](bool isIn, const NSErrorRef& error) {
                                       ends->add((isIn ? "yes, " : "no, ") + domainAndCode(error));
                                     });
                               }};
  const PassedCall folderInfo{
      "shareOptions", [](Protocol& service, const Ends& ends) {
        return service.fetchSharedFolderInfoWithCompletionHandler(
            [ends](bool isIn, const std::optional<std::string>& name, const NSErrorRef& error) {
              ends->add((isIn ? "yes, " : "no, ") + name.value_or("nothing") + ", " +
                        domainAndCode(error));
            });
      }};
  const PassedCall refresh{
      "refreshSharingState", [](Protocol& service, const Ends& ends) {
        return service.refreshSharingStateWithCompletionHandler(
            [ends](const NSErrorRef& error) { ends->add(domainAndCode(error)); });
      }};
  const NSErrorRef refusal = rz_error(RZErrorPermissionFailure, "no");
};

TEST_F(PassedCallsTest, WithoutTheDaemonTheStateOfAFolderIsNoAndTheConnectionsError) {
  EXPECT_EQ(endWithoutDaemon(folderState), "no, NSCocoaErrorDomain 4097");
}

TEST_F(PassedCallsTest, WithoutTheDaemonTheInfoOfAFolderIsNoAndNothingAndTheConnectionsError) {
  EXPECT_EQ(endWithoutDaemon(folderInfo), "no, nothing, NSCocoaErrorDomain 4097");
}

TEST_F(PassedCallsTest, WithoutTheDaemonARefreshIsTheConnectionsErrorAndLogsNoOutcome) {
  EXPECT_EQ(endWithoutDaemon(refresh), "NSCocoaErrorDomain 4097");
  EXPECT_EQ(log.countContaining("refreshing state"), 0U);
}

TEST_F(PassedCallsTest, TheDaemonsRefusalComesWithWhatItSaid) {
  optionsAre({.isShared = true, .folderName = "Plans", .error = refusal});
  EXPECT_EQ(endWhenAnswered(folderState), "yes, RZErrorDomain 12");
  EXPECT_EQ(endWhenAnswered(folderInfo), "yes, Plans, RZErrorDomain 12");
}

TEST_F(PassedCallsTest, ARefreshThatTheDaemonRefusesIsItsErrorAndLogged) {
  daemon.scriptSharing([this](ScriptedSharingAnswers& answers) {
    answers.refreshSharingState = [error = refusal](const std::string&) { return error; };
  });
  EXPECT_EQ(endWhenAnswered(refresh), "RZErrorDomain 12");
  EXPECT_EQ(log.countContaining("error refreshing state"), 1U);
}

TEST_F(PassedCallsTest, AreAnsweredThoughTheyAreCalledOff) {
  optionsAre({.isShared = true, .folderName = "Plans"});
  EXPECT_EQ(endWhenCalledOff(folderState), "yes, nil");
  EXPECT_EQ(endWhenCalledOff(folderInfo), "yes, Plans, nil");
  EXPECT_EQ(endWhenCalledOff(refresh), "nil");
}

}  // namespace
}  // namespace yomber
