#include "platform/ostrell/daemon_connection.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <cstdlib>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "platform/foundation/drive_paths.h"
#include "platform/foundation/file_manager.h"
#include "platform/foundation/serial_queue.h"
#include "platform/ipc/event_loop.h"
#include "platform/ostrell/awaited.h"
#include "platform/ostrell/constants.h"
#include "platform/ostrell/daemon_link.h"
#include "platform/ostrell/file_manager_additions.h"
#include "platform/ostrell/query_item.h"
#include "platform/ostrell/scripted_daemon.h"
#include "platform/ostrell/url_additions.h"

namespace yomber {
namespace {

using Failures = std::shared_ptr<Awaited<NSErrorRef>>;

Failures failures() { return std::make_shared<Awaited<NSErrorRef>>(); }

QSDaemonProxyRef proxy(const Failures& into) {
  return QSDaemonConnection::defaultConnection().remoteObjectProxyWithErrorHandler(
      [into](const NSErrorRef& error) { into->add(error); });
}

/// Asks for a location and answers the error, or nil.
NSErrorRef askForLocation(const std::string& identifier = "d:5") {
  const auto sync = QSDaemonConnection::defaultConnection().newSyncProxy();
  sync->getURLForItemIdentifier(identifier, [&](const NSURLRef& url, const NSErrorRef& error) {
    sync->setObjResult(url, error);
  });
  return sync->error();
}

class DaemonConnectionTest : public testing::Test {
 protected:
  DaemonConnectionTest() {
    daemon.addItem(scriptedDocument(5, "five.txt"), daemon.root() + "/five.txt");
  }

  ScriptedDaemon daemon;
};

TEST_F(DaemonConnectionTest, SyncProxyHoldsWhatTheReplyStored) {
  const auto sync = QSDaemonConnection::defaultConnection().newSyncProxy();
  std::thread::id replyThread;
  sync->getURLForItemIdentifier("d:5", [&](const NSURLRef& url, const NSErrorRef& error) {
    replyThread = std::this_thread::get_id();
    sync->setObjResult(url, error);
  });
  EXPECT_EQ(replyThread, std::this_thread::get_id());
  const auto url = std::dynamic_pointer_cast<const NSURL>(sync->result());
  ASSERT_TRUE(url);
  EXPECT_EQ(url->path(), daemon.root() + "/five.txt");
  EXPECT_FALSE(sync->error());
  EXPECT_FALSE(sync->boolResult());
  sync->setBoolResult(true, nullptr);
  EXPECT_TRUE(sync->boolResult());
}

TEST_F(DaemonConnectionTest, SyncProxyGivesTheDaemonsError) {
  const auto error = askForLocation("d:6");
  ASSERT_TRUE(error);
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSFileNoSuchFileError));
}

TEST_F(DaemonConnectionTest, ASyncCallIsOneRoundTrip) {
  EXPECT_FALSE(askForLocation());
  daemon.forgetCalls();
  EXPECT_FALSE(askForLocation());
  EXPECT_EQ(daemon.calls(), (std::vector<ScriptedDaemon::Call>{{"urlForItemIdentifier", {"d:5"}}}));
}

TEST_F(DaemonConnectionTest, ConnectsLazilyAndOnce) {
  EXPECT_EQ(daemon.connectionCount(), 0U);
  daemon.hold("describe");
  std::vector<std::thread> threads;
  Awaited<NSErrorRef> results;
  for (int i = 0; i < 8; ++i) {
    threads.emplace_back([&] { results.add(askForLocation()); });
  }
  ASSERT_TRUE(daemon.waitForCalls("describe"));
  daemon.release("describe");
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(results.values(), std::vector<NSErrorRef>(8));
  EXPECT_EQ(daemon.callCount("describe"), 1U);
  EXPECT_EQ(daemon.callCount("urlForItemIdentifier"), 8U);
  EXPECT_EQ(daemon.connectionCount(), 1U);
}

TEST_F(DaemonConnectionTest, CallsMadeWhileConnectingKeepTheirOrder) {
  daemon.hold("describe");
  const auto failed = failures();
  const auto calls = proxy(failed);
  Awaited<int> replies;
  calls->currentNotifRankWithReply([&](std::uint64_t, const NSErrorRef&) { replies.add(1); });
  ASSERT_TRUE(daemon.waitForCalls("describe"));
  calls->getURLForItemIdentifier("d:5",
                                 [&](const NSURLRef&, const NSErrorRef&) { replies.add(2); });
  daemon.release("describe");
  calls->enumerateAllFoldersWithSortOrder(
      QSSortOrderByName, 0, 1,
      [&](const QSQueryItems&, std::uint64_t, const NSErrorRef&) { replies.add(3); });
  EXPECT_EQ(replies.wait(3), (std::vector{1, 2, 3}));
  EXPECT_TRUE(failed->values().empty());
}

TEST_F(DaemonConnectionTest, WithoutADaemonCallersFailAtOnce) {
  daemon.stop();
  const auto error = askForLocation();
  ASSERT_TRUE(error);
  const std::string socket = DrivePaths::forHome(daemon.home()).daemonSocket;
  EXPECT_NE(error->localizedDescription().find(socket), std::string::npos)
      << error->localizedDescription();
  const auto failed = failures();
  const auto calls = proxy(failed);
  bool replied = false;
  calls->currentNotifRankWithReply([&](std::uint64_t, const NSErrorRef&) { replied = true; });
  ASSERT_EQ(failed->wait().size(), 1U);
  EXPECT_FALSE(replied);
}

TEST_F(DaemonConnectionTest, TheNextCallReconnects) {
  EXPECT_FALSE(askForLocation());
  daemon.stop();
  EXPECT_TRUE(askForLocation());
  daemon.start();
  EXPECT_FALSE(askForLocation());
  EXPECT_EQ(daemon.callCount("describe"), 2U);
}

TEST_F(DaemonConnectionTest, ACallUnderWayFailsWhenTheDaemonIsLost) {
  daemon.hold("urlForItemIdentifier");
  Awaited<NSErrorRef> result;
  std::thread caller([&] { result.add(askForLocation()); });
  ASSERT_TRUE(daemon.waitForCalls("urlForItemIdentifier"));
  daemon.dropConnections();
  caller.join();
  const auto error = result.values().at(0);
  ASSERT_TRUE(error);
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSXPCConnectionInterrupted)) << error->description();
}

TEST_F(DaemonConnectionTest, AnOrdinaryProxyFailsOnceHoweverManyCallsWereLost) {
  const auto failed = failures();
  const auto calls = proxy(failed);
  daemon.hold("currentNotifRank");
  for (int i = 0; i < 3; ++i) {
    calls->currentNotifRankWithReply([](std::uint64_t, const NSErrorRef&) {});
  }
  ASSERT_TRUE(daemon.waitForCalls("currentNotifRank", 3));
  daemon.dropConnections();
  ASSERT_EQ(failed->wait().size(), 1U);
  EXPECT_TRUE(failed->values()[0]->is(NSCocoaErrorDomain, NSXPCConnectionInterrupted));
  // A call of a proxy that has failed still goes out; the handler, though, was used up.
  daemon.release("currentNotifRank");
  Awaited<std::uint64_t> rank;
  calls->currentNotifRankWithReply(
      [&](std::uint64_t value, const NSErrorRef&) { rank.add(value); });
  EXPECT_EQ(rank.wait(), (std::vector<std::uint64_t>{1}));
  EXPECT_EQ(failed->values().size(), 1U);
}

TEST_F(DaemonConnectionTest, AnIdleOrdinaryProxyHearsNothingOfALoss) {
  const auto failed = failures();
  const auto calls = proxy(failed);
  EXPECT_FALSE(askForLocation());
  daemon.stop();
  EXPECT_TRUE(askForLocation());
  DaemonLink::current()->replyQueue()->sync([] {});
  EXPECT_TRUE(failed->values().empty());
}

TEST_F(DaemonConnectionTest, RepliesComeOnTheReplyQueue) {
  const auto queue = DaemonLink::current()->replyQueue();
  Awaited<bool> onQueue;
  const auto failed = failures();
  const auto calls = proxy(failed);
  calls->currentNotifRankWithReply(
      [&](std::uint64_t, const NSErrorRef&) { onQueue.add(queue->isCurrent()); });
  EXPECT_EQ(onQueue.wait(), std::vector<bool>{true});
  daemon.stop();
  QSDaemonConnection::defaultConnection()
      .remoteObjectProxyWithErrorHandler(
          [&](const NSErrorRef&) { onQueue.add(queue->isCurrent()); })
      ->currentNotifRankWithReply([](std::uint64_t, const NSErrorRef&) {});
  EXPECT_EQ(onQueue.wait(2), (std::vector<bool>{true, true}));
}

TEST_F(DaemonConnectionTest, AReplyHandlerMayMakeSyncCalls) {
  Awaited<NSErrorRef> result;
  const auto failed = failures();
  proxy(failed)->currentNotifRankWithReply(
      [&](std::uint64_t, const NSErrorRef&) { result.add(askForLocation()); });
  EXPECT_EQ(result.wait(), std::vector<NSErrorRef>{nullptr});
}

TEST_F(DaemonConnectionTest, FolderPagesCarryTheirParametersAndItems) {
  const auto item = scriptedDocument(7, "seven.txt", "i:3");
  daemon.script([&](ScriptedDaemon::Answers& answers) {
    answers.enumerateItemsInFolder = [&](const QSFileObjectIDRef&, std::uint8_t, std::uint64_t,
                                         std::uint32_t) {
      return ScriptedDaemon::Page{{item}, 300, nullptr};
    };
  });
  struct Page {
    QSQueryItems items;
    std::uint64_t nextOffset = 0;
    NSErrorRef error;
  };
  Awaited<Page> pages;
  const auto failed = failures();
  const auto calls = proxy(failed);
  const auto keep = [&](const QSQueryItems& items, std::uint64_t nextOffset,
                        const NSErrorRef& error) { pages.add({items, nextOffset, error}); };
  calls->enumerateItemsInFolder(QSFileObjectID::fileObjectIDWithString("i:3"), QSSortOrderByDate,
                                100, 200, keep);
  calls->enumerateItemsInFolder(nullptr, QSSortOrderByName, 0, 200, keep);
  const auto got = pages.wait(2);
  ASSERT_EQ(got.size(), 2U);
  ASSERT_EQ(got[0].items.size(), 1U);
  EXPECT_EQ(got[0].items[0]->fields(), item);
  EXPECT_EQ(got[0].nextOffset, 300U);
  EXPECT_FALSE(got[0].error);
  const auto made = daemon.calls();
  EXPECT_EQ(made[made.size() - 2],
            (ScriptedDaemon::Call{"enumerateItemsInFolder", {"i:3", "1", "100", "200"}}));
  EXPECT_EQ(made.back(), (ScriptedDaemon::Call{"enumerateItemsInFolder", {"", "0", "0", "200"}}));
}

TEST_F(DaemonConnectionTest, ADomainErrorIsAReplyAndNoFailureOfTheProxy) {
  const auto refusal = NSError::errorWithDomain(QSOstrellErrorDomain, QSOstrellErrorLoggedOut);
  daemon.script([&](ScriptedDaemon::Answers& answers) {
    answers.enumerateAllFolders = [=](std::uint8_t, std::uint64_t, std::uint32_t) {
      return ScriptedDaemon::Page{{}, 0, refusal};
    };
    answers.currentNotifRank = [=] { return ScriptedDaemon::Rank{0, refusal}; };
  });
  Awaited<NSErrorRef> errors;
  const auto failed = failures();
  const auto calls = proxy(failed);
  calls->enumerateAllFoldersWithSortOrder(
      QSSortOrderByName, 0, 200,
      [&](const QSQueryItems&, std::uint64_t, const NSErrorRef& error) { errors.add(error); });
  calls->currentNotifRankWithReply(
      [&](std::uint64_t, const NSErrorRef& error) { errors.add(error); });
  const auto got = errors.wait(2);
  ASSERT_EQ(got.size(), 2U);
  for (const auto& error : got) {
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(QSOstrellErrorDomain, QSOstrellErrorLoggedOut));
  }
  EXPECT_TRUE(failed->values().empty());
}

TEST_F(DaemonConnectionTest, WorkingSetChangesRelayTokensUnread) {
  const std::string token("\0\xff token", 8);
  std::optional<std::string> given = "unset";
  daemon.script([&](ScriptedDaemon::Answers& answers) {
    answers.enumerateWorkingSetChanges = [&](const std::optional<std::string>& from,
                                             std::uint32_t) {
      given = from;
      return ScriptedDaemon::Changes{{scriptedDocument(5, "five.txt")},
                                     {QSFileObjectID::fileObjectIDWithString("d:6")},
                                     token,
                                     nullptr};
    };
  });
  for (const NSDataRef& from : {NSDataRef(), NSData::dataWithString(token)}) {
    const auto sync = QSDaemonConnection::defaultConnection().newSyncProxy();
    sync->enumerateWorkingSetChangesFromChangeToken(
        from, 200,
        [&](const QSQueryItems& updated, const std::vector<QSFileObjectIDRef>& deleted,
            const NSDataRef& next, const NSErrorRef& error) {
          ASSERT_EQ(updated.size(), 1U);
          ASSERT_EQ(deleted.size(), 1U);
          EXPECT_EQ(updated[0]->itemIdentifier(), "d:5");
          EXPECT_EQ(deleted[0]->asString(), "d:6");
          sync->setObjResult(next, error);
        });
    EXPECT_FALSE(sync->error());
    EXPECT_TRUE(
        NSData(token).isEqualToData(std::dynamic_pointer_cast<const NSData>(sync->result())));
    EXPECT_EQ(given, from ? std::optional(token) : std::nullopt);
  }
}

TEST_F(DaemonConnectionTest, ItemsWithoutAnIdentityAreLeftOut) {
  auto nameless = scriptedDocument(8, "eight.txt");
  nameless.identifier = "not an id";
  daemon.script([&](ScriptedDaemon::Answers& answers) {
    answers.enumerateAllFolders = [&](std::uint8_t, std::uint64_t, std::uint32_t) {
      return ScriptedDaemon::Page{{nameless, scriptedDocument(5, "five.txt")}, 0, nullptr};
    };
  });
  const auto sync = QSDaemonConnection::defaultConnection().newSyncProxy();
  QSQueryItems got;
  sync->enumerateAllFoldersWithSortOrder(
      QSSortOrderByName, 0, 200,
      [&](const QSQueryItems& items, std::uint64_t, const NSErrorRef&) { got = items; });
  ASSERT_EQ(got.size(), 1U);
  EXPECT_EQ(got[0]->itemIdentifier(), "d:5");
}

TEST_F(DaemonConnectionTest, EightThreadsOfSyncCallsWhileTheDaemonComesAndGoes) {
  std::vector<std::thread> threads;
  std::atomic<int> answered = 0;
  std::atomic<bool> isOver = false;
  for (int i = 0; i < 8; ++i) {
    threads.emplace_back([&] {
      while (!isOver) {
        if (!askForLocation()) ++answered;
      }
    });
  }
  for (int round = 0; round < 5; ++round) {
    const int before = answered;
    EXPECT_TRUE(daemon.waitUntil([&] { return answered >= before + 50; }));
    daemon.dropConnections();
  }
  isOver = true;
  for (auto& thread : threads) thread.join();
  // The last loss may still show once, and never twice.
  if (askForLocation()) {
    EXPECT_FALSE(askForLocation());
  }
}

TEST_F(DaemonConnectionTest, ADaemonOfAnotherHomeIsRefused) {
  // A second daemon whose socket is put where the first one's is.
  const auto paths = DrivePaths::forHome(daemon.home());
  ScriptedDaemon other;
  const std::string otherSocket = DrivePaths::forHome(other.home()).daemonSocket;
  daemon.stop();
  ASSERT_EQ(symlink(otherSocket.c_str(), paths.daemonSocket.c_str()), 0);
  QSDaemonConnection::setDefaultHome(daemon.home());
  const auto error = askForLocation();
  ASSERT_TRUE(error);
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSXPCConnectionInvalid));
  EXPECT_NE(error->localizedDescription().find(other.home()), std::string::npos);
  EXPECT_EQ(unlink(paths.daemonSocket.c_str()), 0);
}

class StuckDaemonTest : public testing::Test {
 protected:
  StuckDaemonTest() {
    setenv("YOMBER_DAEMON_TIMEOUT_MS", "50", 1);
    daemon.emplace();
  }
  ~StuckDaemonTest() override {
    unsetenv("YOMBER_DAEMON_TIMEOUT_MS");
    daemon.reset();
  }
  std::optional<ScriptedDaemon> daemon;
};

TEST_F(StuckDaemonTest, CallsEndWithTheTimeOut) {
  daemon->addItem(scriptedDocument(5, "five.txt"), daemon->root() + "/five.txt");
  EXPECT_FALSE(askForLocation());
  daemon->hold("*");
  const auto error = askForLocation();
  ASSERT_TRUE(error);
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSXPCConnectionTimedOut)) << error->description();
  const auto failed = failures();
  proxy(failed)->currentNotifRankWithReply([](std::uint64_t, const NSErrorRef&) {});
  ASSERT_EQ(failed->wait().size(), 1U);
  EXPECT_TRUE(failed->values()[0]->is(NSCocoaErrorDomain, NSXPCConnectionTimedOut));
  daemon->release("*");
  EXPECT_FALSE(askForLocation());
  EXPECT_EQ(daemon->callCount("describe"), 1U);
}

TEST_F(StuckDaemonTest, WorkThatTakesLongIsWaitedForWhileTheDaemonAnswers) {
  const auto file = daemon->root() + "/five.txt";
  daemon->addItem(scriptedDocument(5, "five.txt"), file);
  const auto url = NSURL::fileURLWithPath(file);
  const auto scan = [&] {
    NSErrorRef error;
    EXPECT_TRUE(QSQueryItem::askDaemonQueryItemForURL(url, ForceScan::Yes, &error));
    return error;
  };
  const auto emptyTrash = [] {
    int answers = 0;
    const auto proxy = QSDaemonConnection::defaultConnection().newSyncProxy();
    proxy->emptyTrashWithReply([&](std::uint64_t, const NSErrorRef&) { ++answers; });
    EXPECT_EQ(answers, 1);
    return proxy->error();
  };
  const auto evict = [&] {
    NSErrorRef error;
    EXPECT_TRUE(evictUbiquitousItemAtURL(NSFileManager::defaultManager(), url, &error));
    return error;
  };
  const std::map<std::string, std::function<NSErrorRef()>> works{
      {"itemAtLocation", scan}, {"emptyTrash", emptyTrash}, {"evict", evict}};
  for (const auto& [method, work] : works) {
    daemon->hold(method);
    daemon->forgetCalls();
    std::thread worker([&, name = method] {
      // So often it was asked whether it is stuck.
      EXPECT_TRUE(daemon->waitForCalls("describe", 5));
      daemon->release(name);
    });
    EXPECT_FALSE(work()) << method;
    worker.join();
  }
}

TEST_F(StuckDaemonTest, WorkOfADaemonThatIsStuckEndsWithTheTimeOutAndIsAnsweredOnce) {
  daemon->addItem(scriptedDocument(5, "five.txt"), daemon->root() + "/five.txt");
  EXPECT_FALSE(askForLocation());
  daemon->hold("*");
  const auto proxy = QSDaemonConnection::defaultConnection().newSyncProxy();
  int answers = 0;
  proxy->emptyTrashWithReply([&](std::uint64_t, const NSErrorRef&) { ++answers; });
  ASSERT_TRUE(proxy->error());
  EXPECT_TRUE(proxy->error()->is(NSCocoaErrorDomain, NSXPCConnectionTimedOut));
  daemon->release("*");
  EXPECT_FALSE(askForLocation());
  EXPECT_EQ(answers, 0);
}

TEST_F(StuckDaemonTest, ConnectingToOneThatNeverAnswersFailsEveryCallerAndIsTriedAgain) {
  daemon->hold("*");
  const auto error = askForLocation();
  ASSERT_TRUE(error);
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSXPCConnectionTimedOut)) << error->description();
  daemon->release("*");
  daemon->addItem(scriptedDocument(5, "five.txt"), daemon->root() + "/five.txt");
  EXPECT_FALSE(askForLocation());
}

TEST(DaemonConnectionDeathTest, WaitingOnTheLoopThreadIsABug) {
  testing::GTEST_FLAG(death_test_style) = "threadsafe";
  QSDaemonConnection::setDefaultHome("/nonexistent");
  EXPECT_DEATH(ipc::EventLoop::shared().runAndWait([] { (void)askForLocation(); }),
               "waiting for the daemon");
}

}  // namespace
}  // namespace yomber
