#include "platform/ostrell/item_notifications.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/foundation/serial_queue.h"
#include "platform/ostrell/awaited.h"
#include "platform/ostrell/constants.h"
#include "platform/ostrell/daemon_connection.h"
#include "platform/ostrell/daemon_link.h"
#include "platform/ostrell/scripted_daemon.h"

namespace yomber {
namespace {

/// Keeps what it received, and the replies it still owes.
class Receiver final : public QSItemNotificationReceiving {
 public:
  void receiveUpdates(const QSQueryItems& items, const std::vector<std::string>&,
                      const std::vector<std::string>&, std::function<void()> reply) override {
    replies.add(std::move(reply));
    batches.add(items);
  }
  void receiveProgressUpdates(const std::vector<std::string>& identifiers,
                              std::function<void()>) override {
    progress.add(identifiers);
  }

  Awaited<QSQueryItems> batches;
  Awaited<std::function<void()>> replies;
  Awaited<std::vector<std::string>> progress;
};

class ItemUpdateSenderTest : public testing::Test {
 protected:
  /// The sender for `receiver`; nil when the daemon refused.
  QSItemUpdateSenderRef subscribe(const std::shared_ptr<Receiver>& to) {
    Awaited<std::pair<QSItemUpdateSenderRef, NSErrorRef>> replies;
    QSDaemonConnection::defaultConnection()
        .remoteObjectProxyWithErrorHandler(
            [&](const NSErrorRef& error) { replies.add({nullptr, error}); })
        ->getItemUpdateSenderWithReceiver(
            to, [&](const QSItemUpdateSenderRef& sender, const auto&, const NSErrorRef& error) {
              replies.add({sender, error});
            });
    const auto got = replies.wait();
    if (got.empty()) return nullptr;
    subscriptionError = got[0].second;
    return got[0].first;
  }
  QSItemUpdateSenderRef proxyOf(const QSItemUpdateSenderRef& sender) {
    return sender->remoteObjectProxyWithErrorHandler(
        [into = failed](const NSErrorRef& error) { into->add(error); });
  }
  /// Everything that was on its way to the reply queue has been delivered.
  static void drainReplies() {
    DaemonLink::current()->replyQueue()->sync([] {});
  }

  ScriptedDaemon daemon;
  std::shared_ptr<Receiver> receiver = std::make_shared<Receiver>();
  std::shared_ptr<Awaited<NSErrorRef>> failed = std::make_shared<Awaited<NSErrorRef>>();
  NSErrorRef subscriptionError;
};

TEST_F(ItemUpdateSenderTest, CallsReachTheDaemonInOrder) {
  const auto proxy = proxyOf(subscribe(receiver));
  daemon.forgetCalls();
  Awaited<int> replies;
  proxy->boostPriority([&] { replies.add(1); });
  proxy->watchItemAtURL(NSURL::fileURLWithPath(daemon.root()), 19,
                        [&](const NSErrorRef& error) { replies.add(error ? -1 : 2); });
  EXPECT_EQ(replies.wait(2), (std::vector{1, 2}));
  EXPECT_EQ(daemon.calls(),
            (std::vector<ScriptedDaemon::Call>{{"boostPriority", {"0"}},
                                               {"watchItem", {"0", daemon.root(), "19"}}}));
  EXPECT_TRUE(failed->values().empty());
}

TEST_F(ItemUpdateSenderTest, ARefusedWatchIsTheGatherReplysError) {
  daemon.script([](ScriptedDaemon::Answers& answers) {
    answers.watchItem = [](const std::string&, std::uint32_t) {
      return NSError::errorWithDomain(NSCocoaErrorDomain, NSFileNoSuchFileError);
    };
  });
  const auto proxy = proxyOf(subscribe(receiver));
  Awaited<NSErrorRef> replies;
  proxy->watchItemAtURL(NSURL::fileURLWithPath("/nowhere"), 19,
                        [&](const NSErrorRef& error) { replies.add(error); });
  proxy->watchItemAtURL(nullptr, 19, [&](const NSErrorRef& error) { replies.add(error); });
  for (const auto& error : replies.wait(2)) {
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSFileNoSuchFileError));
  }
  EXPECT_TRUE(failed->values().empty());
}

TEST_F(ItemUpdateSenderTest, ARefusedSubscriptionIsTheReplysError) {
  daemon.script([](ScriptedDaemon::Answers& answers) {
    answers.getItemUpdateSender = [] {
      return NSError::errorWithDomain(QSOstrellErrorDomain, QSOstrellErrorLoggedOut);
    };
  });
  EXPECT_FALSE(subscribe(receiver));
  ASSERT_TRUE(subscriptionError);
  EXPECT_TRUE(subscriptionError->is(QSOstrellErrorDomain, QSOstrellErrorLoggedOut));
}

TEST_F(ItemUpdateSenderTest, ABatchIsAnsweredWhenItsReplyIsCalled) {
  const auto sender = subscribe(receiver);
  Awaited<NSErrorRef> answered;
  auto dead = scriptedDocument(6, "");
  dead.flags = 1;
  daemon.sendUpdates(0, {scriptedDocument(5, "five.txt"), dead},
                     [&](const NSErrorRef& error) { answered.add(error); });
  const auto batches = receiver->batches.wait();
  ASSERT_EQ(batches.size(), 1U);
  ASSERT_EQ(batches[0].size(), 2U);
  EXPECT_EQ(batches[0][0]->filename(), "five.txt");
  EXPECT_FALSE(batches[0][0]->isDead());
  EXPECT_TRUE(batches[0][1]->isDead());
  EXPECT_EQ(batches[0][1]->fileObjectID()->asString(), "d:6");
  // A later call has been served meanwhile, so the answer is not merely late.
  (void)subscribe(receiver);
  EXPECT_TRUE(answered.values().empty());
  receiver->replies.values().at(0)();
  EXPECT_EQ(answered.wait(), std::vector<NSErrorRef>{nullptr});
}

TEST_F(ItemUpdateSenderTest, ProgressNeedsNoReply) {
  const auto sender = subscribe(receiver);
  daemon.sendProgressUpdates(0, {"d:5", "d:6"});
  EXPECT_EQ(receiver->progress.wait(), (std::vector<std::vector<std::string>>{{"d:5", "d:6"}}));
}

TEST_F(ItemUpdateSenderTest, EveryProxyHeldHearsOfALostDaemon) {
  const auto sender = subscribe(receiver);
  const auto first = proxyOf(sender);
  const auto second = proxyOf(sender);
  (void)proxyOf(sender);  // dropped: hears nothing
  daemon.dropConnections();
  const auto errors = failed->wait(2);
  ASSERT_EQ(errors.size(), 2U);
  for (const auto& error : errors) {
    EXPECT_TRUE(error->is(QSOstrellErrorDomain, QSOstrellErrorConnectionLost));
    ASSERT_TRUE(error->underlyingError());
    EXPECT_EQ(error->underlyingError()->domain(), NSCocoaErrorDomain);
  }
  // Each proxy once, though calls fail as well; one made afterwards hears at once.
  first->boostPriority({});
  const auto late = proxyOf(sender);
  EXPECT_EQ(failed->wait(3).size(), 3U);
  drainReplies();
  EXPECT_EQ(failed->values().size(), 3U);
}

TEST_F(ItemUpdateSenderTest, ADroppedProxysCallUnderWayStillHears) {
  const auto sender = subscribe(receiver);
  daemon.hold("watchItem");
  proxyOf(sender)->watchItemAtURL(NSURL::fileURLWithPath(daemon.root()), 19,
                                  [](const NSErrorRef&) {});
  ASSERT_TRUE(daemon.waitForCalls("watchItem"));
  daemon.dropConnections();
  const auto errors = failed->wait();
  ASSERT_EQ(errors.size(), 1U);
  EXPECT_TRUE(errors[0]->is(QSOstrellErrorDomain, QSOstrellErrorConnectionLost));
}

TEST_F(ItemUpdateSenderTest, TheDaemonsReasonReachesTheProxies) {
  const auto proxy = proxyOf(subscribe(receiver));
  daemon.failSender(0,
                    NSError::errorWithDomain(QSOstrellErrorDomain, QSOstrellErrorWatcherTooSlow));
  const auto errors = failed->wait();
  ASSERT_EQ(errors.size(), 1U);
  EXPECT_TRUE(errors[0]->is(QSOstrellErrorDomain, QSOstrellErrorWatcherTooSlow));
  EXPECT_TRUE(daemon.waitUntil([&] { return !daemon.isSubscribed(0); }));
}

TEST_F(ItemUpdateSenderTest, AnotherDomainsReasonGoesUnderALostConnection) {
  const auto proxy = proxyOf(subscribe(receiver));
  daemon.failSender(0, NSError::errorWithErrno(EIO));
  const auto errors = failed->wait();
  ASSERT_EQ(errors.size(), 1U);
  EXPECT_TRUE(errors[0]->is(QSOstrellErrorDomain, QSOstrellErrorConnectionLost));
  EXPECT_TRUE(errors[0]->underlyingError()->is(NSPOSIXErrorDomain, EIO));
}

TEST_F(ItemUpdateSenderTest, BatchesComeBeforeTheFailureThatFollowsThem) {
  const auto proxy = proxyOf(subscribe(receiver));
  daemon.sendUpdates(0, {scriptedDocument(5, "five.txt")});
  daemon.failSender(0,
                    NSError::errorWithDomain(QSOstrellErrorDomain, QSOstrellErrorWatcherTooSlow));
  ASSERT_EQ(failed->wait().size(), 1U);
  EXPECT_EQ(receiver->batches.values().size(), 1U);
}

TEST_F(ItemUpdateSenderTest, AProxyAloneKeepsTheSubscription) {
  auto sender = subscribe(receiver);
  auto proxy = proxyOf(sender);
  sender.reset();
  Awaited<int> replies;
  proxy->boostPriority([&] { replies.add(1); });
  ASSERT_EQ(replies.wait().size(), 1U);
  EXPECT_TRUE(daemon.isSubscribed(0));
  proxy.reset();
  EXPECT_TRUE(daemon.waitUntil([&] { return !daemon.isSubscribed(0); }));
}

TEST_F(ItemUpdateSenderTest, DroppingTheSenderEndsTheSubscription) {
  auto sender = subscribe(receiver);
  ASSERT_TRUE(daemon.isSubscribed(0));
  sender.reset();
  EXPECT_TRUE(daemon.waitUntil([&] { return !daemon.isSubscribed(0); }));
}

TEST_F(ItemUpdateSenderTest, InvalidateEndsItWithoutAnError) {
  const auto sender = subscribe(receiver);
  const auto proxy = proxyOf(sender);
  proxy->invalidate();
  EXPECT_TRUE(daemon.waitForCalls("invalidate"));
  EXPECT_TRUE(daemon.waitUntil([&] { return !daemon.isSubscribed(0); }));
  // Another subscription tells when the loss has been told to all.
  const auto other = subscribe(receiver);
  Awaited<NSErrorRef> told;
  const auto otherProxy =
      other->remoteObjectProxyWithErrorHandler([&](const NSErrorRef& error) { told.add(error); });
  daemon.dropConnections();
  ASSERT_EQ(told.wait().size(), 1U);
  drainReplies();
  EXPECT_TRUE(failed->values().empty());
  proxy->boostPriority({});
  const auto errors = failed->wait();
  ASSERT_EQ(errors.size(), 1U);
  EXPECT_EQ(errors[0]->domain(), QSOstrellErrorDomain);
}

TEST_F(ItemUpdateSenderTest, AReceiverThatIsGoneEndsItsSubscription) {
  const auto sender = subscribe(receiver);
  receiver.reset();
  Awaited<NSErrorRef> answered;
  daemon.sendUpdates(0, {scriptedDocument(5, "five.txt")},
                     [&](const NSErrorRef& error) { answered.add(error); });
  EXPECT_EQ(answered.wait(), std::vector<NSErrorRef>{nullptr});
  EXPECT_TRUE(daemon.waitUntil([&] { return !daemon.isSubscribed(0); }));
}

TEST_F(ItemUpdateSenderTest, ASubscriptionIsNotFoundAgainAfterAReconnect) {
  const auto proxy = proxyOf(subscribe(receiver));
  daemon.dropConnections();
  ASSERT_EQ(failed->wait().size(), 1U);
  const auto again = proxyOf(subscribe(receiver));
  Awaited<int> replies;
  again->boostPriority([&] { replies.add(1); });
  EXPECT_EQ(replies.wait().size(), 1U);
  EXPECT_EQ(daemon.calls().back(), (ScriptedDaemon::Call{"boostPriority", {"1"}}));
}

}  // namespace
}  // namespace yomber
