// The notification channel: registration with the daemon, its loss, the account, the list of
// containers, invalidation.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>
#include <thread>

#include "platform/foundation/notification_center.h"
#include "provider/testing/file_enumerator_fixture.h"
#include "provider/testing/gate.h"

namespace yomber {
namespace {

using ::testing::Contains;
using ::testing::Each;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

using Call = ScriptedDaemon::Call;

constexpr const char* kAssertion = "[CRIT] Assertion failed: !_isSettingUpNotificationReceiving";
constexpr const char* kAccountLine =
    "[NOTICE] received account did update notification, invalidating change token";
constexpr const char* kContainersLine =
    "[DEBUG] ┏# container list did change, invalidating our change token";
constexpr const char* kInvalidating = "[DEBUG] invalidating change token";
constexpr auto kWatchfulness = std::chrono::milliseconds(50);

void postAccountTokenDidChange() {
  NSNotificationCenter::defaultCenter().postNotificationName(QSAccountTokenDidChangeNotification);
}
void postContainerListDidChange() {
  NSNotificationCenter::defaultCenter().postNotificationName(QSContainerListDidChangeNotification);
}

std::string fetchErrorLine(const NSErrorRef& error) {
  return "[DEBUG] There was an error while fetching items: " + error->description();
}

class RegistrationTest : public FileEnumeratorFixture {
 protected:
  /// Registers, and waits for the answer.
  NSErrorRef setUp() { return setUp(enumerator); }
  static NSErrorRef setUp(const std::shared_ptr<QSFileEnumerator>& of) {
    Gate finished;
    NSErrorRef result;
    of->setupNotificationReceivingIfNeededWithCompletion([&](const NSErrorRef& error) {
      result = error;
      finished.open();
    });
    EXPECT_TRUE(finished.wait());
    return result;
  }
  /// Registers, and gets one batch of the subscription; so the watch's reply has arrived before.
  void setUpAndReceive(std::size_t subscription, const std::vector<ItemFields>& items) {
    EXPECT_EQ(setUp(), nullptr);
    Gate answered;
    daemon.sendUpdates(subscription, items, [&](const NSErrorRef& error) {
      EXPECT_EQ(error, nullptr);
      answered.open();
    });
    EXPECT_TRUE(answered.wait());
  }
  /// Waits until all that was put on the enumerator's queue before has run.
  static void drain(const std::shared_ptr<QSFileEnumerator>& of) { of->_accountTokenDidChange(); }

  bool isFresh(const NSFileProviderSyncAnchor& anchor) {
    return currentAnchor(enumerator)->isEqualToData(anchor);
  }
  bool waitUntilDropped(const NSFileProviderSyncAnchor& anchor) {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    while (isFresh(anchor) && std::chrono::steady_clock::now() < deadline) {
      std::this_thread::yield();
    }
    return !isFresh(anchor);
  }
  void refuseSubscriptionsWith(const NSErrorRef& error) {
    daemon.script([&](ScriptedDaemon::Answers& answers) {
      answers.getItemUpdateSender = [error] { return error; };
    });
  }
  void answerWatchesWith(const NSErrorRef& error) {
    daemon.script([&](ScriptedDaemon::Answers& answers) {
      answers.watchItem = [error](const std::string&, std::uint32_t) { return error; };
    });
  }
  /// Releases the last reference to the enumerator and says whether it is destroyed.
  bool isDestroyedWhenReleased() {
    const std::weak_ptr<QSFileEnumerator> weak = enumerator;
    enumerator.reset();
    return daemon.waitUntil([&weak] { return weak.expired(); });
  }

  const NSFileProviderSyncAnchor first = currentAnchor(enumerator);
};

// ---- Registration ------------------------------------------------------------------------------

TEST_F(RegistrationTest, TheSenderIsBoostedAndThenWatchesTheFoldersChildren) {
  EXPECT_EQ(setUp(), nullptr);
  ASSERT_TRUE(daemon.waitForCalls("watchItem"));
  EXPECT_EQ(daemonCalls({"getItemUpdateSender", "boostPriority", "watchItem"}),
            (std::vector<std::string>{"getItemUpdateSender", "boostPriority", "watchItem"}));
  EXPECT_THAT(daemon.calls(), Contains(Call{"watchItem", {"0", inRoot("folder"), "19"}}));
}

TEST_F(RegistrationTest, ARecursiveEnumeratorWatchesTheWholeSubtree) {
  const auto recursive = makeEnumerator(Recursive::Yes);
  EXPECT_EQ(setUp(recursive), nullptr);
  ASSERT_TRUE(daemon.waitForCalls("watchItem"));
  EXPECT_THAT(daemon.calls(), Contains(Call{"watchItem", {"0", inRoot("folder"), "23"}}));
}

TEST_F(RegistrationTest, TheWatchsReplyIsNotWaitedFor) {
  daemon.hold("watchItem");
  EXPECT_EQ(setUp(), nullptr);
  daemon.release("watchItem");
}

TEST_F(RegistrationTest, ARegisteredEnumeratorDoesNotRegisterAgain) {
  EXPECT_EQ(setUp(), nullptr);
  EXPECT_EQ(setUp(), nullptr);
  EXPECT_EQ(daemon.callCount("getItemUpdateSender"), 1U);
  EXPECT_EQ(log.countContaining("[CRIT]"), 0U);
}

TEST_F(RegistrationTest, ARegistrationWithoutACompletionIsMadeToo) {
  enumerator->setupNotificationReceivingIfNeededWithCompletion(nullptr);
  EXPECT_TRUE(daemon.waitForCalls("watchItem"));
}

TEST_F(RegistrationTest, ARefusedRegistrationIsReportedAndTheNextOneTriesAgain) {
  refuseSubscriptionsWith(NSError::errorWithDomain("SomeDomain", 6));
  EXPECT_EQ(domainAndCode(setUp()), "SomeDomain 6");
  refuseSubscriptionsWith(nullptr);
  EXPECT_EQ(setUp(), nullptr);
  EXPECT_EQ(daemon.callCount("getItemUpdateSender"), 2U);
  EXPECT_EQ(log.countContaining("[CRIT]"), 0U);
  EXPECT_TRUE(isFresh(first));
}

TEST_F(RegistrationTest, ALostConnectionWhileRegisteringIsReportedAndTheNextOneTriesAgain) {
  daemon.stop();
  EXPECT_NE(setUp(), nullptr);
  daemon.start();
  EXPECT_EQ(setUp(), nullptr);
  EXPECT_EQ(log.countContaining("[CRIT]"), 0U);
}

TEST_F(RegistrationTest, ASecondRegistrationWhileOneIsInFlightSaysSoAndGoesOn) {
  daemon.hold("getItemUpdateSender");
  Gate finished[2];
  for (auto& gate : finished) {
    enumerator->setupNotificationReceivingIfNeededWithCompletion([&gate](const NSErrorRef& error) {
      EXPECT_EQ(error, nullptr);
      gate.open();
    });
  }
  ASSERT_TRUE(daemon.waitForCalls("getItemUpdateSender", 2));
  EXPECT_EQ(log.count(LogLevel::Fault, kAssertion), 1U);
  daemon.release("getItemUpdateSender");
  EXPECT_TRUE(finished[0].wait());
  EXPECT_TRUE(finished[1].wait());
  EXPECT_EQ(setUp(), nullptr);
  EXPECT_EQ(log.count(LogLevel::Fault, kAssertion), 1U);
  EXPECT_EQ(daemon.callCount("getItemUpdateSender"), 2U);
}

TEST_F(RegistrationTest, TheDaemonsBatchesArriveAndAreAnswered) {
  setUpAndReceive(0, {scriptedDocument(5, "five"), dead(scriptedDocument(6, "six"))});
  EXPECT_THAT(manager.signals(), ElementsAre("i:3"));
  const auto observer = changesFrom(first);
  EXPECT_THAT(observer->updated(), ElementsAre("d:5"));
  EXPECT_THAT(observer->deleted(), ElementsAre("d:6"));
}

TEST_F(RegistrationTest, AProgressUpdateOfTheDaemonDoesNotHoldUpTheNextBatch) {
  EXPECT_EQ(setUp(), nullptr);
  daemon.sendProgressUpdates(0, {"d:5"});
  Gate answered;
  daemon.sendUpdates(0, {scriptedDocument(5, "five")}, [&](const NSErrorRef&) { answered.open(); });
  EXPECT_TRUE(answered.wait());
  EXPECT_THAT(manager.signals(), ElementsAre("i:3"));
}

// ---- Losing the channel ------------------------------------------------------------------------

TEST_F(RegistrationTest, AFailureOfTheDaemonsOwnDomainDropsTheHistoryAndSignals) {
  setUpAndReceive(0, {scriptedDocument(5, "five")});
  const auto error = NSError::errorWithDomain(QSOstrellErrorDomain, QSOstrellErrorWatcherTooSlow);
  daemon.failSender(0, error);
  ASSERT_TRUE(manager.waitForSignals(2));
  EXPECT_FALSE(isFresh(first));
  EXPECT_GE(log.count(LogLevel::Debug, fetchErrorLine(error)), 1U);
  EXPECT_THAT(changesFrom(currentAnchor(enumerator))->calls(), ElementsAre("anchor"));
  // The next listing registers again.
  EXPECT_EQ(setUp(), nullptr);
  EXPECT_EQ(daemon.callCount("getItemUpdateSender"), 2U);
}

TEST_F(RegistrationTest, AFailureOfAnotherDomainDropsTheHistoryWithoutASignal) {
  answerWatchesWith(NSError::errorWithDomain("SomeDomain", 6));
  EXPECT_EQ(setUp(), nullptr);
  ASSERT_TRUE(waitUntilDropped(first));
  // The account's change finds no sender, so it signals too: one signal in all, not two.
  postAccountTokenDidChange();
  EXPECT_THAT(manager.signals(), ElementsAre("i:3"));
  // What was sent to the daemon before has arrived when the next registration is answered.
  EXPECT_EQ(setUp(), nullptr);
  EXPECT_EQ(daemon.callCount("invalidate"), 0U);
}

TEST_F(RegistrationTest, AFailedWatchDropsTheHistoryAndTheNextListingRegistersAgain) {
  const auto error = NSError::errorWithDomain(QSOstrellErrorDomain, 3);
  answerWatchesWith(error);
  EXPECT_EQ(setUp(), nullptr);
  ASSERT_TRUE(manager.waitForSignals(1));
  EXPECT_FALSE(isFresh(first));
  EXPECT_EQ(log.countContaining("There was an error while fetching items: "), 1U);
  answerWatchesWith(nullptr);
  EXPECT_EQ(setUp(), nullptr);
  EXPECT_EQ(daemon.callCount("getItemUpdateSender"), 2U);
  EXPECT_EQ(daemon.callCount("invalidate"), 0U);
}

TEST_F(RegistrationTest, ALostConnectionDropsTheHistoryAndSignals) {
  setUpAndReceive(0, {scriptedDocument(5, "five")});
  daemon.dropConnections();
  ASSERT_TRUE(manager.waitForSignals(2));
  EXPECT_FALSE(isFresh(first));
  EXPECT_THAT(changesFrom(currentAnchor(enumerator))->calls(), ElementsAre("anchor"));
  EXPECT_GE(log.countContaining("There was an error while fetching items: "), 1U);
  EXPECT_EQ(setUp(), nullptr);
  EXPECT_EQ(daemon.subscriptionCount(), 2U);
}

// ---- The account and the list of containers ----------------------------------------------------

TEST_F(RegistrationTest, AnAccountChangeWithALiveSenderDropsNothing) {
  EXPECT_EQ(setUp(), nullptr);
  receive({scriptedDocument(5, "five")});
  postAccountTokenDidChange();
  EXPECT_EQ(log.count(LogLevel::Default, kAccountLine), 1U);
  EXPECT_EQ(log.count(LogLevel::Debug, kInvalidating), 0U);
  EXPECT_THAT(manager.signals(), ElementsAre("i:3"));
  EXPECT_THAT(changesFrom(first)->updated(), ElementsAre("d:5"));
}

TEST_F(RegistrationTest, AnAccountChangeWithoutASenderDropsTheHistoryAndSignalsBeforeItReturns) {
  refuseSubscriptionsWith(NSError::errorWithDomain("SomeDomain", 6));
  EXPECT_NE(setUp(), nullptr);
  receive({scriptedDocument(5, "five")});
  postAccountTokenDidChange();
  EXPECT_EQ(log.count(LogLevel::Default, kAccountLine), 1U);
  EXPECT_FALSE(isFresh(first));
  EXPECT_THAT(manager.signals(), ElementsAre("i:3", "i:3"));
  EXPECT_THAT(changesFrom(currentAnchor(enumerator))->calls(), ElementsAre("anchor"));
}

TEST_F(RegistrationTest, AnAccountChangeWaitsForTheQueue) {
  Gate running;
  Gate goOn;
  Gate posted;
  enumerator->setupNotificationReceivingIfNeededWithCompletion([&](const NSErrorRef&) {
    running.open();
    EXPECT_TRUE(goOn.wait());
  });
  ASSERT_TRUE(running.wait());
  std::thread poster([&] {
    postAccountTokenDidChange();
    posted.open();
  });
  EXPECT_TRUE(log.waitFor(LogLevel::Default, kAccountLine));
  EXPECT_FALSE(posted.wait(kWatchfulness));
  goOn.open();
  EXPECT_TRUE(posted.wait());
  poster.join();
}

TEST_F(RegistrationTest, NothingIsObservedBeforeTheFirstRegistration) {
  postAccountTokenDidChange();
  EXPECT_EQ(log.count(LogLevel::Default, kAccountLine), 0U);
}

TEST_F(RegistrationTest, TheAccountIsObservedOnceHoweverOftenTheFolderIsListed) {
  for (int i = 0; i < 3; ++i) EXPECT_EQ(setUp(), nullptr);
  postAccountTokenDidChange();
  EXPECT_EQ(log.count(LogLevel::Default, kAccountLine), 1U);
}

TEST_F(RegistrationTest, TheRootAsksForTheContainersAndObservesTheirList) {
  enumerator = makeRootEnumerator();
  const auto anchor = currentAnchor(enumerator);
  EXPECT_EQ(setUp(), nullptr);
  EXPECT_GE(daemon.callCount("containers"), 1U);
  log.forget();
  postContainerListDidChange();
  EXPECT_FALSE(isFresh(anchor));
  EXPECT_THAT(manager.signals(), ElementsAre(NSFileProviderRootContainerItemIdentifier));
  const std::vector<std::string> expected{kContainersLine, kInvalidating,
                                          "[DEBUG] signal changes to fileproviderd", "[DEBUG] ┗# "};
  EXPECT_EQ(among(log.texts(), expected), expected);
}

TEST_F(RegistrationTest, AChangeOfTheContainersThatTheDaemonTellsReachesTheRoot) {
  enumerator = makeRootEnumerator();
  EXPECT_EQ(setUp(), nullptr);
  ASSERT_TRUE(daemon.waitUntil([&] { return daemon.observerCount() > 0; }));
  daemon.postContainerListDidChange();
  EXPECT_TRUE(log.waitFor(LogLevel::Debug, kContainersLine));
  EXPECT_TRUE(manager.waitForSignals(1));
}

TEST_F(RegistrationTest, AFolderDoesNotObserveTheListOfContainers) {
  EXPECT_EQ(setUp(), nullptr);
  EXPECT_EQ(daemon.callCount("containers"), 0U);
  postContainerListDidChange();
  EXPECT_EQ(log.count(LogLevel::Debug, kContainersLine), 0U);
  EXPECT_TRUE(isFresh(first));
}

TEST_F(RegistrationTest, AnAccountChangeWhileTheRootWaitsForTheContainersEndsBoth) {
  enumerator = makeRootEnumerator();
  daemon.hold("containers");
  Gate finished;
  enumerator->setupNotificationReceivingIfNeededWithCompletion(
      [&](const NSErrorRef&) { finished.open(); });
  ASSERT_TRUE(daemon.waitForCalls("containers"));
  std::thread poster([] { postAccountTokenDidChange(); });
  EXPECT_TRUE(log.waitFor(LogLevel::Default, kAccountLine));
  EXPECT_FALSE(finished.isOpen());
  daemon.release("containers");
  poster.join();
  EXPECT_TRUE(finished.wait());
}

// ---- Invalidation ------------------------------------------------------------------------------

TEST_F(RegistrationTest, InvalidationInvalidatesTheSenderAndStopsObserving) {
  EXPECT_EQ(setUp(), nullptr);
  enumerator->invalidate();
  EXPECT_TRUE(daemon.waitForCalls("invalidate"));
  EXPECT_THAT(daemon.calls(), Contains(Call{"invalidate", {"0"}}));
  drain(enumerator);
  log.forget();
  postAccountTokenDidChange();
  EXPECT_THAT(log.texts(), ::testing::Not(Contains(kAccountLine)));
}

TEST_F(RegistrationTest, ARootStopsObservingTheListOfContainersToo) {
  enumerator = makeRootEnumerator();
  EXPECT_EQ(setUp(), nullptr);
  enumerator->invalidate();
  drain(enumerator);
  postContainerListDidChange();
  EXPECT_EQ(log.count(LogLevel::Debug, kContainersLine), 0U);
}

TEST_F(RegistrationTest, InvalidationDuringTheRegistrationInvalidatesTheSenderThatArrives) {
  daemon.hold("getItemUpdateSender");
  Gate finished;
  NSErrorRef result;
  enumerator->setupNotificationReceivingIfNeededWithCompletion([&](const NSErrorRef& error) {
    result = error;
    finished.open();
  });
  ASSERT_TRUE(daemon.waitForCalls("getItemUpdateSender"));
  enumerator->invalidate();
  daemon.release("getItemUpdateSender");
  ASSERT_TRUE(finished.wait());
  EXPECT_EQ(result, nullptr);
  EXPECT_TRUE(daemon.waitForCalls("invalidate"));
  EXPECT_EQ(daemon.callCount("watchItem"), 0U);
  EXPECT_EQ(daemon.callCount("boostPriority"), 0U);
}

TEST_F(RegistrationTest, InvalidationIsForGood) {
  enumerator->invalidate();
  EXPECT_EQ(setUp(), nullptr);
  EXPECT_EQ(setUp(), nullptr);
  EXPECT_EQ(daemon.callCount("watchItem"), 0U);
  log.forget();
  postAccountTokenDidChange();
  EXPECT_EQ(log.count(LogLevel::Default, kAccountLine), 0U);
  EXPECT_EQ(log.countContaining("[CRIT]"), 0U);
}

TEST_F(RegistrationTest, InvalidatingTwiceInvalidatesTheSenderOnce) {
  EXPECT_EQ(setUp(), nullptr);
  enumerator->invalidate();
  enumerator->invalidate();
  drain(enumerator);
  EXPECT_TRUE(daemon.waitForCalls("invalidate"));
  (void)list(nullptr);
  // The second is the one of the sender that this listing got and did not want.
  EXPECT_TRUE(daemon.waitForCalls("invalidate", 2));
  EXPECT_EQ(daemon.callCount("invalidate"), 2U);
}

// ---- Lifetime ----------------------------------------------------------------------------------

TEST_F(RegistrationTest, AfterInvalidationTheLastReferenceDestroysIt) {
  EXPECT_EQ(setUp(), nullptr);
  ASSERT_TRUE(daemon.waitForCalls("watchItem"));
  enumerator->invalidate();
  drain(enumerator);
  EXPECT_TRUE(isDestroyedWhenReleased());
}

TEST_F(RegistrationTest, WithoutInvalidationTheLastReferenceDestroysItAndEndsItsSubscription) {
  EXPECT_EQ(setUp(), nullptr);
  ASSERT_TRUE(daemon.waitForCalls("watchItem"));
  EXPECT_TRUE(isDestroyedWhenReleased());
  EXPECT_TRUE(daemon.waitUntil([&] { return !daemon.isSubscribed(0); }));
}

TEST_F(RegistrationTest, ARegisteredEnumeratorThatListedIsDestroyedByTheLastReference) {
  EXPECT_THAT(list(nullptr)->error(), nullptr);
  EXPECT_TRUE(isDestroyedWhenReleased());
}

TEST_F(RegistrationTest, AWatchThatIsNeverAnsweredDoesNotKeepItAlive) {
  daemon.hold("watchItem");
  EXPECT_EQ(setUp(), nullptr);
  ASSERT_TRUE(daemon.waitForCalls("watchItem"));
  EXPECT_TRUE(isDestroyedWhenReleased());
  daemon.release("watchItem");
}

TEST_F(RegistrationTest, AListingInFlightFinishesAlthoughTheLastReferenceIsGone) {
  answerPageWith({.items = {scriptedDocument(5, "five")}, .nextOffset = 0, .error = nullptr});
  daemon.hold("getItemUpdateSender");
  auto observer = std::make_shared<RecordingEnumerationObserver>();
  enumerator->enumerateItemsForObserver(observer, nullptr);
  ASSERT_TRUE(daemon.waitForCalls("getItemUpdateSender"));
  const std::weak_ptr<QSFileEnumerator> weak = enumerator;
  enumerator.reset();
  daemon.release("getItemUpdateSender");
  ASSERT_TRUE(observer->waitUntilFinished());
  EXPECT_THAT(observer->identifiers(), ElementsAre("d:5"));
  EXPECT_TRUE(daemon.waitUntil([&weak] { return weak.expired(); }));
}

TEST_F(RegistrationTest, NotificationsWhileItIsBeingDestroyedAreHarmless) {
  std::thread poster([] {
    for (int i = 0; i < 200; ++i) {
      postAccountTokenDidChange();
      postContainerListDidChange();
    }
  });
  for (int i = 0; i < 20; ++i) {
    auto root = makeRootEnumerator();
    EXPECT_EQ(setUp(root), nullptr);
    if (i % 2 == 0) root->invalidate();
  }
  poster.join();
  EXPECT_THAT(manager.signals(), Each(NSFileProviderRootContainerItemIdentifier));
}

}  // namespace
}  // namespace yomber
