#include "platform/ostrell/content_protocol.h"

#include <gtest/gtest.h>

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "platform/ostrell/awaited.h"
#include "platform/ostrell/daemon_connection.h"
#include "platform/ostrell/errors.h"
#include "platform/ostrell/scripted_daemon.h"

namespace yomber {
namespace {

using Call = ScriptedDaemon::Call;

class ContentCallsTest : public testing::Test {
 protected:
  static QSDaemonSyncProxyRef sync() {
    return QSDaemonConnection::defaultConnection().newSyncProxy();
  }
  /// The failure that a call replies, made on a synchronous proxy.
  static NSErrorRef failureOf(
      const std::function<void(QSDaemonProtocol&, const QSErrorReply&)>& call) {
    const auto proxy = sync();
    call(*proxy, [&](const NSErrorRef& error) { proxy->setBoolResult(!error, error); });
    return proxy->error();
  }
  Call lastCall() const { return daemon.calls().back(); }

  ScriptedDaemon daemon;
  const NSURLRef url = NSURL::fileURLWithPath(daemon.root() + "/a\xff.txt");
  const NSErrorRef refusal = NSError::errorWithDomain(QSOstrellErrorDomain, 6);
};

TEST_F(ContentCallsTest, EvictingSendsTheLocationAndBringsTheRefusal) {
  const auto evict = [&](QSDaemonProtocol& daemonProxy, const QSErrorReply& reply) {
    daemonProxy.evictItemAtURL(url, reply);
  };
  EXPECT_FALSE(failureOf(evict));
  EXPECT_EQ(lastCall(), (Call{"evict", {url->path()}}));
  daemon.scriptContent([&](ScriptedContentAnswers& answers) {
    answers.evict = [error = refusal](const std::string&) { return error; };
  });
  const auto failure = failureOf(evict);
  ASSERT_TRUE(failure);
  EXPECT_TRUE(failure->is(QSOstrellErrorDomain, QSOstrellErrorCannotEvict));
}

TEST_F(ContentCallsTest, SettersSendTheirValuesAndTheAbsenceOfOne) {
  const auto expectCall = [&](const Call& expected, const auto& call) {
    EXPECT_FALSE(failureOf(call));
    EXPECT_EQ(lastCall(), expected);
  };
  using Proxy = QSDaemonProtocol;
  expectCall({"setPinned", {url->path(), "true"}},
             [&](Proxy& p, const QSErrorReply& reply) { p.setPinned(true, url, reply); });
  expectCall({"setLastUsedDate", {url->path(), "-5"}}, [&](Proxy& p, const QSErrorReply& reply) {
    p.setLastUsedDate(NSDate::fromNanoseconds(-5), url, reply);
  });
  expectCall({"setLastUsedDate", {url->path(), ""}}, [&](Proxy& p, const QSErrorReply& reply) {
    p.setLastUsedDate(std::nullopt, url, reply);
  });
  expectCall({"setFavoriteRank", {url->path(), "0"}},
             [&](Proxy& p, const QSErrorReply& reply) { p.setFavoriteRank(0, url, reply); });
  expectCall({"setFavoriteRank", {url->path(), ""}}, [&](Proxy& p, const QSErrorReply& reply) {
    p.setFavoriteRank(std::nullopt, url, reply);
  });
  expectCall(
      {"setTagNames", {url->path(), "red", "b c"}},
      [&](Proxy& p, const QSErrorReply& reply) { p.setTagNames({"red", "b c"}, url, reply); });
  expectCall({"setTagNames", {url->path()}},
             [&](Proxy& p, const QSErrorReply& reply) { p.setTagNames({}, url, reply); });
}

TEST_F(ContentCallsTest, TheStateOfAnItemComesWhole) {
  daemon.scriptContent([&](ScriptedContentAnswers& answers) {
    answers.contentState = [error = refusal](const std::string&) {
      QSContentState state;
      state.local = QSContentState::Local::Evicting;
      state.upload = QSContentState::Upload::Waiting;
      state.isPinned = true;
      state.size = 1ULL << 40U;
      state.localBytes = 4096;
      state.lastFailure = error;
      return ScriptedContentAnswers::State{state, nullptr};
    };
  });
  QSContentState state;
  sync()->contentStateOfItemAtURL(url, [&](const QSContentState& got, const NSErrorRef& error) {
    state = got;
    EXPECT_FALSE(error);
  });
  EXPECT_EQ(state.local, QSContentState::Local::Evicting);
  EXPECT_EQ(state.upload, QSContentState::Upload::Waiting);
  EXPECT_TRUE(state.isPinned);
  EXPECT_EQ(state.size, 1ULL << 40U);
  EXPECT_EQ(state.localBytes, 4096U);
  ASSERT_TRUE(state.lastFailure);
  EXPECT_TRUE(state.lastFailure->is(QSOstrellErrorDomain, 6));
}

TEST_F(ContentCallsTest, TransfersComeWhole) {
  daemon.scriptContent([&](ScriptedContentAnswers& answers) {
    answers.transfers = [location = url, error = refusal] {
      QSTransfers transfers;
      transfers.transfers.push_back({.url = location,
                                     .kind = QSTransfer::Kind::Download,
                                     .total = 10,
                                     .done = 4,
                                     .attempts = 2,
                                     .failure = error,
                                     .nextAttempt = NSDate::fromNanoseconds(7)});
      transfers.waiting = 3;
      transfers.finished = 9;
      return transfers;
    };
  });
  QSTransfers got;
  sync()->transfersWithReply([&](const QSTransfers& transfers) { got = transfers; });
  ASSERT_EQ(got.transfers.size(), 1U);
  const QSTransfer& transfer = got.transfers.front();
  EXPECT_EQ(transfer.url->path(), url->path());
  EXPECT_EQ(transfer.kind, QSTransfer::Kind::Download);
  EXPECT_EQ(transfer.total, 10U);
  EXPECT_EQ(transfer.done, 4U);
  EXPECT_EQ(transfer.attempts, 2U);
  EXPECT_TRUE(transfer.failure);
  EXPECT_EQ(transfer.nextAttempt, NSDate::fromNanoseconds(7));
  EXPECT_EQ(got.waiting, 3U);
  EXPECT_EQ(got.finished, 9U);
}

TEST_F(ContentCallsTest, AContainersLocationComesWithItsName) {
  NSURLRef location;
  std::string name;
  sync()->getContainerURLForID(QSUbiquitousDefaultContainerID, RecreateDocuments::Yes,
                               [&](const NSURLRef& answer, const std::string& displayName,
                                   std::uint64_t, const NSErrorRef& error) {
                                 location = answer;
                                 name = displayName;
                                 EXPECT_FALSE(error);
                               });
  ASSERT_TRUE(location);
  EXPECT_EQ(location->path(), daemon.root());
  EXPECT_EQ(name, QSUbiquitousDefaultContainerID);
  EXPECT_EQ(lastCall(), (Call{"containerLocation", {QSUbiquitousDefaultContainerID, "true"}}));
}

TEST_F(ContentCallsTest, AContainerWithNeitherLocationNorErrorIsAnErrorAllTheSame) {
  daemon.scriptContent([](ScriptedContentAnswers& answers) {
    answers.containerLocation = [](const std::string&, bool) {
      return ScriptedContentAnswers::ContainerLocation{};
    };
  });
  NSErrorRef failure;
  sync()->getContainerURLForID(
      "org.example.App", RecreateDocuments::No,
      [&](const NSURLRef& answer, const std::string&, std::uint64_t, const NSErrorRef& error) {
        EXPECT_FALSE(answer);
        failure = error;
      });
  ASSERT_TRUE(failure);
  EXPECT_TRUE(failure->is(NSCocoaErrorDomain, NSXPCConnectionReplyInvalid));
}

TEST_F(ContentCallsTest, EmptyingTheTrashRepliesItsFailure) {
  daemon.scriptContent([&](ScriptedContentAnswers& answers) {
    answers.emptyTrash = [error = refusal] { return error; };
  });
  NSErrorRef failure;
  sync()->emptyTrashWithReply([&](std::uint64_t, const NSErrorRef& error) { failure = error; });
  ASSERT_TRUE(failure);
  EXPECT_EQ(failure->code(), 6);
}

TEST_F(ContentCallsTest, TheAsynchronousProxyRepliesOrFailsOnce) {
  const auto failures = std::make_shared<Awaited<NSErrorRef>>();
  const auto proxy = QSDaemonConnection::defaultConnection().remoteObjectProxyWithErrorHandler(
      [failures](const NSErrorRef& error) { failures->add(error); });
  Awaited<std::string> replies;
  proxy->trashItemAtURL(url, [&](const NSURLRef&, const NSErrorRef& error) {
    replies.add(error->domain() + std::to_string(error->code()));
  });
  EXPECT_EQ(replies.wait(), std::vector<std::string>{"NSCocoaErrorDomain4"});
  daemon.hold("putBackLocation");
  proxy->putBackURLForTrashedItemAtURL(
      url, [&](const NSURLRef&, const NSErrorRef&) { replies.add("put back"); });
  ASSERT_TRUE(daemon.waitForCalls("putBackLocation"));
  daemon.dropConnections();
  ASSERT_EQ(failures->wait().size(), 1U);
  EXPECT_TRUE(failures->values()[0]->is(NSCocoaErrorDomain, NSXPCConnectionInterrupted));
  EXPECT_EQ(replies.values().size(), 1U);
}

TEST_F(ContentCallsTest, TheNextCallAfterALossAsksTheNewDaemonForContent) {
  const auto evict = [&](QSDaemonProtocol& daemonProxy, const QSErrorReply& reply) {
    daemonProxy.evictItemAtURL(url, reply);
  };
  EXPECT_FALSE(failureOf(evict));
  daemon.stop();
  EXPECT_TRUE(failureOf(evict));
  daemon.start();
  EXPECT_FALSE(failureOf(evict));
  EXPECT_EQ(daemon.callCount("evict"), 2U);
}

}  // namespace
}  // namespace yomber
