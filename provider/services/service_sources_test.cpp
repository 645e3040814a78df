// The two service sources: how they listen, and how their connections live and end.

#include <gtest/gtest.h>
#include <sys/socket.h>

#include <algorithm>
#include <chrono>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "platform/ostrell/awaited.h"
#include "platform/xpc/listener.h"
#include "provider/services/listening_service_source.h"
#include "provider/testing/service_connections_fixture.h"

namespace yomber {
namespace {

using Texts = std::vector<std::string>;

/// What the two sources have in common.
class ServiceSourcesTest : public ServiceConnectionsTest {
  struct Each {
    std::string name;
    std::shared_ptr<ListeningServiceSource> source;
    NSXPCInterfaceRef interface;
    /// Waits for one reply; the failure of the call itself otherwise.
    std::function<NSErrorRef(const NSXPCConnectionRef&)> ask;

    [[nodiscard]] std::string line(const std::string& what) const {
      return "[DEBUG] " + name + " service source connection " + what;
    }
  };

 protected:
  static bool becomesInvalidated(const NSXPCListener& listener) {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    while (!listener.isInvalidated() && std::chrono::steady_clock::now() < deadline) {
      std::this_thread::yield();
    }
    return listener.isInvalidated();
  }

  const std::vector<Each> sources{
      {"sharing", sharing, getSharingServiceInterface(),
       [this](const NSXPCConnectionRef& connection) { return isShared(connection); }},
      {"collaboration", collaboration, collaborationInterface(),
       [this](const NSXPCConnectionRef& connection) { return fetchesAVersion(connection); }}};
};

TEST_F(ServiceSourcesTest, AreCalledTheSameForEveryItem) {
  EXPECT_EQ(sharing->serviceName(), "com.kelvo.Ostrell.SharingV1");
  EXPECT_EQ(collaboration->serviceName(), "com.kelvo.PandrelCollaboration");
  EXPECT_EQ(QSSharingClient::initWithFileProviderExtension(extension, "i:9", queue)->serviceName(),
            sharing->serviceName());
}

TEST_F(ServiceSourcesTest, KeepAListenerForEachEndpointUntilItsClientHasConnected) {
  for (const auto& each : sources) {
    SCOPED_TRACE(each.name);
    const NSErrorRef untouched = NSError::errorWithDomain("untouched", 1);
    NSErrorRef error = untouched;
    const auto first = each.source->makeListenerEndpointAndReturnError(&error);
    const auto second = each.source->makeListenerEndpointAndReturnError(&error);
    EXPECT_EQ(error, untouched) << "the error is never written";
    ASSERT_NE(first, nullptr);
    EXPECT_NE(first, second);
    EXPECT_EQ(each.source->waitingListenerCount(), 2U);
    const auto client = NSXPCConnection::initWithListenerEndpoint(first);
    client->setRemoteObjectInterface(each.interface);
    client->resume();
    EXPECT_EQ(each.ask(client), nullptr);
    EXPECT_EQ(each.source->waitingListenerCount(), 1U);
  }
}

TEST_F(ServiceSourcesTest, KeepAListenerWhoseClientNeverComes) {
  for (const auto& each : sources) {
    SCOPED_TRACE(each.name);
    auto endpoint = each.source->makeListenerEndpointAndReturnError();
    const auto settled = std::make_shared<Awaited<bool>>();
    endpoint->whenSettled([settled] { settled->add(true); });
    endpoint = nullptr;
    ASSERT_EQ(settled->wait().size(), 1U) << "the listener has heard that nobody will come";
    EXPECT_EQ(each.source->waitingListenerCount(), 1U);
  }
}

TEST_F(ServiceSourcesTest, EndTheirListenersWithThem) {
  auto source = QSSharingClient::initWithFileProviderExtension(extension, "d:5", queue);
  const auto endpoint = source->makeListenerEndpointAndReturnError();
  source = nullptr;
  const auto ends = std::make_shared<Awaited<std::string>>();
  const auto client = NSXPCConnection::initWithListenerEndpoint(endpoint);
  client->setInterruptionHandler([ends] { ends->add("interrupted"); });
  client->setInvalidationHandler([ends] { ends->add("invalidated"); });
  client->resume();
  EXPECT_EQ(ends->wait(2), (Texts{"interrupted", "invalidated"}));
}

TEST_F(ServiceSourcesTest, LetGoOfTheListenerWhenTheConnectionIsInvalidated) {
  for (const auto& each : sources) {
    SCOPED_TRACE(each.name);
    const auto listener = NSXPCListener::anonymousListener();
    const auto client = NSXPCConnection::initWithListenerEndpoint(listener->endpoint());
    client->setRemoteObjectInterface(each.interface);
    listener->setDelegate(each.source);
    listener->resume();
    client->resume();
    EXPECT_EQ(each.ask(client), nullptr);
    EXPECT_FALSE(listener->isInvalidated());
    client->invalidate();
    ASSERT_TRUE(log.waitFor(LogLevel::Debug, each.line("invalidated")));
    EXPECT_TRUE(becomesInvalidated(*listener)) << "by the invalidation handler, after its line";
    EXPECT_EQ(log.countContaining("connection interrupted"), 0U) << "it was a goodbye";
  }
}

TEST_F(ServiceSourcesTest, KeepConnectionsWithoutTheSource) {
  auto source = QSSharingClient::initWithFileProviderExtension(extension, "d:5", queue);
  const auto client = connect(*source, getSharingServiceInterface());
  EXPECT_EQ(isShared(client), nullptr);
  source = nullptr;
  EXPECT_EQ(isShared(client), nullptr);
}

TEST_F(ServiceSourcesTest, EndAnInterruptedConnectionAndItsListener) {
  for (const auto& each : sources) {
    SCOPED_TRACE(each.name);
    const auto listener = NSXPCListener::anonymousListener();
    listener->setDelegate(each.source);
    const auto endpoint = listener->endpoint();
    listener->resume();
    {
      // Speaks and is gone, without a goodbye.
      const ipc::UniqueFd socket = endpoint->takeSocket();
      ASSERT_EQ(::send(socket.get(), "Y", 1, MSG_NOSIGNAL), 1);
    }
    ASSERT_TRUE(becomesInvalidated(*listener)) << "by the invalidation handler, after its line";
    // The connections of earlier tests may end meanwhile, but none of them was interrupted.
    const Texts both{each.line("interrupted"), each.line("invalidated")};
    Texts lines = among(log.texts(), both);
    lines.erase(lines.begin(), std::ranges::find(lines, both.front()));
    ASSERT_GE(lines.size(), 2U);
    EXPECT_EQ(Texts(lines.begin(), lines.begin() + 2), both);
  }
}

TEST_F(ServiceSourcesTest, GiveEachConnectionItsOwnCachedShare) {
  const auto first = connectToSharing();
  const auto second = connectToSharing();
  const auto fetch = [&](const NSXPCConnectionRef& connection) {
    const auto failures = std::make_shared<Awaited<NSErrorRef>>();
    connection->remoteObjectProxyWithErrorHandler<QSSharingServiceV1>(into(failures))
        ->fetchShareWithCompletion(
            [failures](const RZShareRef&, const NSErrorRef& error) { failures->add(error); });
    return only(failures);
  };
  daemon.scriptSharing([](ScriptedSharingAnswers& answers) {
    answers.copyShare = [](const std::string&) {
      return ScriptedSharingAnswers::Share{.share = scriptedShare("five.txt")};
    };
  });
  EXPECT_EQ(fetch(first), nullptr);
  EXPECT_EQ(fetch(first), nullptr);
  EXPECT_EQ(daemon.callCount("copyShare"), 1U) << "the second came from the cache";
  EXPECT_EQ(fetch(second), nullptr);
  EXPECT_EQ(daemon.callCount("copyShare"), 2U);
}

TEST_F(ServiceSourcesTest, RefuseToSaveWhatIsNoShare) {
  const auto client = connectToSharing();
  const auto failures = std::make_shared<Awaited<NSErrorRef>>();
  const auto progress =
      client->remoteObjectProxyWithErrorHandler<QSSharingServiceV1>(into(failures))
          ->saveShare(nullptr, [errors = errors](const RZShareRef& saved, const NSErrorRef& error) {
            EXPECT_EQ(saved, nullptr);
            errors->add(error);
          });
  const NSErrorRef error = only(errors);
  EXPECT_EQ(domainAndCode(error), "NSPOSIXErrorDomain 22");
  EXPECT_NE(error->localizedDescription().find("no share"), std::string::npos);
  EXPECT_EQ(daemon.callCount("saveShare"), 0U);
  EXPECT_EQ(isShared(client), nullptr) << "the connection stays";
  EXPECT_TRUE(failures->values().empty());
}

TEST_F(ServiceSourcesTest, ServeCollaborationOverTheConnection) {
  const auto client = connectToCollaboration();
  const auto failures = std::make_shared<Awaited<NSErrorRef>>();
  const auto proxy =
      client->remoteObjectProxyWithErrorHandler<QSFileProviderPandrelCollaboration>(into(failures));
  const auto answers = std::make_shared<Awaited<std::string>>();
  proxy->fetchVersionAndCapabilitiesWithCompletionHandler(
      [answers](std::uint64_t version, std::uint64_t capabilities, const NSErrorRef& error) {
        answers->add(std::to_string(version) + " " + std::to_string(capabilities) + " " +
                     domainAndCode(error));
      });
  EXPECT_EQ(answers->wait(1), Texts{"1 82 nil"});
  proxy->fetchFileProviderIdentifierWithCompletionHandler(
      [answers](const std::optional<std::string>& identifier, const NSErrorRef& error) {
        answers->add(identifier.value_or("nil") + " " + domainAndCode(error));
      });
  EXPECT_EQ(answers->wait(2).back(), "com.kelvo.Ostrell nil");
  proxy->fetchCollaborationTokenWithCompletionHandler(
      [answers](const std::optional<std::string>& provider, const std::optional<std::string>& base,
                const std::optional<std::string>& share, const std::optional<NSDate>& date,
                const NSErrorRef& error) {
        answers->add(provider.value_or("nil") + " " + base.value_or("nil") + " " +
                     share.value_or("nil") + " " +
                     (date == NSDate::distantFuture() ? "never" : "sometime") + " " +
                     domainAndCode(error));
      });
  EXPECT_EQ(answers->wait(3).back(), "com.kelvo.Ostrell base share never nil");
}

TEST_F(ServiceSourcesTest, LeaveThreeMethodsOutAndKeepTheConnection) {
  const auto client = connectToCollaboration();
  const auto failures = std::make_shared<Awaited<NSErrorRef>>();
  const auto proxy =
      client->remoteObjectProxyWithErrorHandler<QSFileProviderPandrelCollaboration>(into(failures));
  proxy->setEnvironmentType(1);
  proxy->documentIsInUseWithTimeout(2.5);
  (void)proxy->fetchPrivacyStateWithCompletionHandler(
      [](bool, bool, const NSURLRef&, const NSErrorRef&) { ADD_FAILURE() << "it replied"; });
  const auto all = failures->wait(3);
  ASSERT_EQ(all.size(), 3U);
  for (const auto& error : all) EXPECT_EQ(domainAndCode(error), "NSCocoaErrorDomain 4101");
  const auto answers = std::make_shared<Awaited<NSErrorRef>>();
  proxy->fetchURLForSharingFileWithCompletionHandler(
      [answers](const NSURLRef& url, const NSErrorRef& error) {
        EXPECT_EQ(url, nullptr);
        answers->add(error);
      });
  EXPECT_EQ(only(answers), nullptr);
}

TEST_F(ServiceSourcesTest, AnswerACallOfTheOtherInterfaceWithAnErrorAndKeepTheConnection) {
  for (const std::size_t place : {0U, 1U}) {
    const auto& each = sources[place];
    const auto& other = sources[1 - place];
    SCOPED_TRACE(each.name);
    const auto ends = std::make_shared<Awaited<std::string>>();
    const auto client = NSXPCConnection::initWithListenerEndpoint(
        each.source->makeListenerEndpointAndReturnError());
    client->setRemoteObjectInterface(other.interface);
    client->setInterruptionHandler([ends] { ends->add("interrupted"); });
    client->setInvalidationHandler([ends] { ends->add("invalidated"); });
    client->resume();
    // Had the first ended the connection, the second would fail as interrupted or invalid.
    EXPECT_EQ(domainAndCode(other.ask(client)), "NSCocoaErrorDomain 4101");
    EXPECT_EQ(domainAndCode(other.ask(client)), "NSCocoaErrorDomain 4101");
    EXPECT_EQ(ends->values(), Texts());
    client->invalidate();
    EXPECT_EQ(ends->wait(), Texts{"invalidated"});
  }
}

}  // namespace
}  // namespace yomber
