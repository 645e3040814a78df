#include "fileproviderd/container_watch.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <random>

#include "fileproviderd/fake_container.h"
#include "platform/fileprovider/errors.h"

namespace yomber {
namespace {

using namespace std::chrono_literals;
using testing::ElementsAre;
using testing::IsEmpty;

const NSErrorRef kLost = NSError::errorWithDomain(NSCocoaErrorDomain, NSXPCConnectionInterrupted);
const NSErrorRef kSignedOut =
    NSError::errorWithDomain(NSFileProviderErrorDomain, NSFileProviderErrorNotAuthenticated);

class ContainerWatchTest : public testing::Test {
 protected:
  void SetUp() override {
    for (const char* identifier : {"a", "b", "c", "d", "e"}) container.put(identifier);
  }

  void start(const std::string& name = "i:1") {
    watch = std::make_shared<ContainerWatch>(
        name, container, clock, watcher, [] { return 0.0; }, limits);
    container.watches.push_back(watch);
    watch->start();
  }
  void run() { ASSERT_TRUE(executor.drain()) << "it never comes to rest"; }
  void startAndRun(const std::string& name = "i:1") {
    start(name);
    run();
    watcher->calls.clear();
  }
  void pass(std::chrono::milliseconds time) {
    clock.advance(time, [this] { (void)executor.drain(); });
    run();
  }

  ManualExecutor executor;
  FakeClock clock;
  FakeContainer container{executor};
  ContainerWatch::Limits limits;
  std::shared_ptr<RecordingWatcher> watcher = std::make_shared<RecordingWatcher>(executor);
  std::shared_ptr<ContainerWatch> watch;
};

TEST_F(ContainerWatchTest, TakesTheAnchorBeforeTheFirstPageAndListsEverything) {
  start();
  ASSERT_TRUE(executor.step());
  EXPECT_EQ(container.anchorsAsked, 1);
  EXPECT_EQ(container.pagesAsked, 0);
  run();
  EXPECT_THAT(watcher->calls, ElementsAre("list 3", "list 2", "list 0 last"));
  EXPECT_EQ(watcher->items, container.items);
  EXPECT_TRUE(watch->isLive());
}

TEST_F(ContainerWatchTest, TellsEachChangeAndNeverAsksForTheAnchorAgain) {
  startAndRun();
  container.put("f");
  run();
  container.remove("a");
  run();
  container.put("b", 2);
  run();
  EXPECT_THAT(watcher->calls, ElementsAre("update f", "delete a", "update b"));
  EXPECT_EQ(watcher->items, container.items);
  EXPECT_EQ(container.anchorsAsked, 1);
}

TEST_F(ContainerWatchTest, OneRequestIsInFlightAndOneRemembered) {
  startAndRun();
  const int before = container.changesAsked;
  for (int i = 0; i < 100; ++i) watch->signalled();
  run();
  EXPECT_EQ(container.changesAsked - before, 2);
  EXPECT_EQ(container.mostChangesInFlight, 1);
}

TEST_F(ContainerWatchTest, DrainsChangesWhileItListsAndAppliesThemAfter) {
  int page = 0;
  container.beforeEachPage = [&] {
    if (++page != 2) return;
    container.put("a", 2);  // listed already
    container.remove("b");  // listed already
    container.put("0");     // before the cursor: no page shows it
    container.remove("e");  // on the page to come
  };
  start();
  run();
  EXPECT_EQ(watcher->items, container.items);
  EXPECT_TRUE(watch->isLive());
  EXPECT_EQ(container.anchorsAsked, 1);
}

TEST_F(ContainerWatchTest, DrainingKeepsAHistoryFromOverflowing) {
  for (int i = 0; i < 60; ++i) container.put("m" + std::to_string(100 + i));
  container.historyLimit = 10;
  int round = 0;
  container.beforeEachPage = [&] {
    for (int i = 0; i < 8; ++i)
      container.put("z" + std::to_string(i), static_cast<std::uint64_t>(++round));
  };
  start();
  run();
  EXPECT_EQ(container.anchorsAsked, 1) << "it had to list again";
  EXPECT_EQ(watcher->items, container.items);
}

TEST_F(ContainerWatchTest, AChangeOlderThanTheListedItemIsNotTold) {
  startAndRun();
  ItemFields newer = container.items["a"];
  newer.version = 9;
  newer.rank += 100;
  container.items["a"] = newer;
  container.signalAll();
  container.expireAll();
  run();
  pass(10s);
  ASSERT_EQ(watcher->items["a"].version, 9U);
  watcher->calls.clear();
  container.put("a", 3);  // its rank is lower
  run();
  EXPECT_THAT(watcher->calls, IsEmpty());
  EXPECT_EQ(watcher->items["a"].version, 9U);
}

TEST_F(ContainerWatchTest, ListsAgainWhenTheAnchorExpiresAndTellsOnlyTheDifference) {
  startAndRun();
  pass(2s);
  container.items.erase("a");
  container.items["b"].version = 7;
  container.items["f"] = container.items["b"];
  container.items["f"].identifier = "f";
  container.expireAll();
  container.signalAll();
  run();
  EXPECT_THAT(watcher->calls, ElementsAre("update b", "update f", "delete a"));
  EXPECT_EQ(watcher->items, container.items);
  EXPECT_EQ(container.anchorsAsked, 2);
  EXPECT_EQ(container.opened, 2) << "the folder may have moved since it was opened";
  EXPECT_EQ(container.liveEnumerators(), 1U);
  EXPECT_FALSE(watcher->isPaused) << "an expired anchor is no failure";
}

TEST_F(ContainerWatchTest, AFolderThatExpiresAgainAndAgainStillConverges) {
  container.historyLimit = 4;
  startAndRun();
  int round = 0;
  for (int storm = 0; storm < 200; ++storm) {
    for (int i = 0; i < 10; ++i) {
      container.put("s" + std::to_string((storm + i) % 20), static_cast<std::uint64_t>(++round));
    }
    container.remove("s" + std::to_string(storm % 20));
    pass(10ms);
  }
  const int passes = container.anchorsAsked;
  EXPECT_LT(passes, 200 / 4) << "it lists again without pause";
  pass(6s);
  EXPECT_EQ(watcher->items, container.items);
  EXPECT_TRUE(watch->isLive());
}

TEST_F(ContainerWatchTest, LosesNothingWhenTheExtensionDies) {
  startAndRun();
  watch->extensionDidEnd(kLost);
  EXPECT_EQ(container.liveEnumerators(), 0U) << "its enumerators die with it";
  container.put("f");
  container.remove("c");
  run();
  EXPECT_THAT(watcher->calls, ElementsAre("pause 4097"));
  pass(100ms);
  EXPECT_THAT(watcher->calls, ElementsAre("pause 4097", "update f", "delete c", "resume"));
  EXPECT_EQ(watcher->items, container.items);
}

TEST_F(ContainerWatchTest, ADropInMidListingStartsOverAndTellsNoItemTwice) {
  start();
  while (watcher->calls.empty()) ASSERT_TRUE(executor.step());
  watch->extensionDidEnd(kLost);
  pass(100ms);
  EXPECT_THAT(watcher->calls,
              ElementsAre("list 3", "pause 4097", "list 2", "list 0 last", "resume"));
  EXPECT_EQ(watcher->items, container.items);
}

TEST_F(ContainerWatchTest, RetriesFailuresWithBackoffAndPausesOnce) {
  container.openError = kLost;
  start();
  run();
  clock.delays.clear();
  pass(60s);
  EXPECT_THAT(watcher->calls, ElementsAre("pause 4097"));
  ASSERT_GE(clock.delays.size(), 8U);
  EXPECT_EQ(clock.delays[0], 100ms);
  EXPECT_EQ(clock.delays[1], 200ms);
  EXPECT_EQ(clock.delays.back(), 5s);
  EXPECT_LT(clock.delays.size(), 25U) << "a storm";
  container.openError = nullptr;
  pass(5s);
  EXPECT_EQ(watcher->items, container.items);
  EXPECT_EQ(watcher->calls.back(), "resume");
}

TEST_F(ContainerWatchTest, WakingTriesAtOnce) {
  container.openError = kLost;
  start();
  run();
  pass(20s);
  container.openError = nullptr;
  watch->wake();
  run();
  EXPECT_TRUE(watch->isLive());
  EXPECT_EQ(watcher->items, container.items);
}

TEST_F(ContainerWatchTest, SigningOutDropsTheEnumeratorAndSigningInResumes) {
  startAndRun();
  container.changesError = kSignedOut;
  container.openError = kSignedOut;
  container.signalAll();
  run();
  EXPECT_EQ(container.liveEnumerators(), 0U);
  EXPECT_THAT(watcher->calls, ElementsAre("pause -1000"));
  EXPECT_EQ(watcher->items.size(), 5U) << "what was told stays";
  container.items.erase("a");
  container.changesError = nullptr;
  container.openError = nullptr;
  watch->accountMayHaveChanged();
  run();
  EXPECT_THAT(watcher->calls, ElementsAre("pause -1000", "delete a", "resume"));
}

TEST_F(ContainerWatchTest, AnAccountsChangeHurriesNobodyWhoWaitsForSomethingElse) {
  container.openError = kLost;
  start();
  run();
  clock.delays.clear();
  const auto storm = [this] {
    for (int i = 0; i < 1000; ++i) {
      watch->accountMayHaveChanged();
      run();
    }
  };
  storm();
  EXPECT_THAT(clock.delays, IsEmpty()) << "it tried again";
  container.openError = nullptr;
  pass(10s);
  ASSERT_TRUE(watch->isLive());
  // Listed again at once the first time, and with a pause from then on.
  container.expireAll();
  container.signalAll();
  run();
  container.expireAll();
  container.signalAll();
  run();
  ASSERT_FALSE(watch->isLive());
  const int passes = container.anchorsAsked;
  storm();
  for (int i = 0; i < 1000; ++i) watch->wake();
  run();
  EXPECT_EQ(container.anchorsAsked, passes) << "it lists again without pause";
}

TEST_F(ContainerWatchTest, AFolderThatIsGoneEndsTheWatch) {
  startAndRun();
  container.expireAll();
  container.pageError = fileProviderErrorForNonExistentItemWithIdentifier("i:1");
  container.isReallyGone = true;
  container.signalAll();
  run();
  pass(1s);
  EXPECT_THAT(watcher->calls, ElementsAre(testing::StartsWith("delete "), "end -1005"));
  EXPECT_TRUE(watcher->items.empty());
  EXPECT_TRUE(watch->hasEnded());
  EXPECT_EQ(container.liveEnumerators(), 0U);
  const int pages = container.pagesAsked;
  watch->wake();
  watch->signalled();
  watch->extensionDidEnd(kLost);
  pass(60s);
  EXPECT_EQ(container.pagesAsked, pages) << "it goes on after its end";
}

TEST_F(ContainerWatchTest, AFolderThatIsRemovedEndsTheWatch) {
  for (const bool tellsAsDead : {false, true}) {
    container.tellsDeletionsAsDead = tellsAsDead;
    container.isReallyGone = false;
    container.put("a");
    startAndRun();
    container.isReallyGone = true;
    container.remove("a");
    container.remove("i:1");
    run();
    EXPECT_THAT(watcher->calls,
                ElementsAre("delete a", testing::StartsWith("delete "), "end -1005"));
    EXPECT_TRUE(watch->hasEnded());
    EXPECT_EQ(container.liveEnumerators(), 0U);
    watcher = std::make_shared<RecordingWatcher>(executor);
  }
}

TEST_F(ContainerWatchTest, AFolderThatIsRemovedWhileItIsListedEndsTheWatch) {
  bool isFirstPage = true;
  container.beforeEachPage = [&] {
    if (!std::exchange(isFirstPage, false)) return;
    container.isReallyGone = true;
    container.remove("i:1");
  };
  start();
  run();
  EXPECT_EQ(watcher->calls.back(), "end -1005");
  EXPECT_TRUE(watcher->items.empty());
}

TEST_F(ContainerWatchTest, AFolderThatOnlySeemsGoneIsTriedAgain) {
  startAndRun();
  container.openError = fileProviderErrorForNonExistentItemWithIdentifier("i:1");
  watch->extensionDidEnd(kLost);
  pass(10s);
  EXPECT_THAT(watcher->calls, ElementsAre("pause 4097"));
  EXPECT_EQ(watcher->items.size(), 5U);
  container.openError = nullptr;
  pass(10s);
  EXPECT_EQ(watcher->calls.back(), "resume");
}

TEST_F(ContainerWatchTest, TheRootNeverEnds) {
  container.isReallyGone = true;
  container.openError = fileProviderErrorForNonExistentItemWithIdentifier("root");
  start(NSFileProviderRootContainerItemIdentifier);
  run();
  pass(20s);
  EXPECT_FALSE(watch->hasEnded());
}

TEST_F(ContainerWatchTest, AContainerThatTellsNoChangesCannotBeWatched) {
  container.tellsChanges = false;
  start();
  run();
  EXPECT_THAT(watcher->calls, ElementsAre("end 3328"));
}

TEST_F(ContainerWatchTest, TheWorkingSetComesThroughItsChanges) {
  container.isWorkingSet = true;
  container.changesPerAnswer = 2;
  start(NSFileProviderWorkingSetContainerItemIdentifier);
  run();
  EXPECT_EQ(watcher->items, container.items);
  EXPECT_EQ(watcher->calls.back(), "list 0 last");
  watcher->calls.clear();
  container.put("f");
  run();
  EXPECT_THAT(watcher->calls, ElementsAre("update f"));
  // A new extension replays all of it; the watcher hears only what is new.
  watcher->calls.clear();
  container.items.erase("a");
  watch->extensionDidEnd(kLost);
  pass(1s);
  EXPECT_THAT(watcher->calls, ElementsAre("pause 4097", "delete a", "resume"));
  EXPECT_EQ(watcher->items, container.items);
}

TEST_F(ContainerWatchTest, ASlowWatcherIsSentTheDifferenceAndNothingIsBuffered) {
  container.historyLimit = 10;
  startAndRun();
  pass(2s);
  watcher->holds = true;
  container.put("f");
  run();
  const int before = container.changesAsked;
  for (int round = 0; round < 50; ++round) {
    for (int i = 0; i < 20; ++i) {
      container.put("n" + std::to_string(i), static_cast<std::uint64_t>(round + 1));
    }
    run();
  }
  EXPECT_EQ(container.changesAsked, before) << "changes are asked for that nobody takes";
  EXPECT_THAT(watcher->calls, ElementsAre("update f"));
  watcher->release();
  run();
  pass(1s);
  EXPECT_EQ(watcher->items, container.items);
  EXPECT_LT(watcher->calls.size(), 20U);
}

TEST_F(ContainerWatchTest, TooManyChangesDuringAListingStartItAgain) {
  limits.drained = 3;
  bool isBusy = true;
  container.beforeEachPage = [&] {
    if (!isBusy) return;
    for (int i = 0; i < 8; ++i) container.put("x" + std::to_string(i));
  };
  start();
  run();
  EXPECT_FALSE(watch->isLive());
  isBusy = false;
  const int before = container.pagesAsked;
  pass(1s);
  EXPECT_TRUE(watch->isLive());
  EXPECT_EQ(watcher->items, container.items);
  const auto wholeListing = container.items.size() / container.pageSize + 1;
  EXPECT_EQ(container.pagesAsked - before, static_cast<int>(wholeListing));
}

TEST_F(ContainerWatchTest, DeadItemsAmongTheUpdatesAreDeletions) {
  container.tellsDeletionsAsDead = true;
  bool isFirstPage = true;
  container.beforeEachPage = [&] {
    if (std::exchange(isFirstPage, false)) container.remove("e");
  };
  start();
  run();
  EXPECT_EQ(watcher->items, container.items);
  watcher->calls.clear();
  container.remove("a");
  run();
  EXPECT_THAT(watcher->calls, ElementsAre("delete a"));
}

TEST_F(ContainerWatchTest, BigBatchesComeInPieces) {
  limits.itemsPerCall = 2;
  startAndRun();
  for (int i = 0; i < 5; ++i) container.put("p" + std::to_string(i));
  run();
  for (const auto& call : watcher->calls)
    EXPECT_LE(call.size(), std::string("update p0 p1").size());
  EXPECT_EQ(watcher->items, container.items);
}

TEST_F(ContainerWatchTest, DroppingTheWatchInvalidatesItsEnumerator) {
  startAndRun();
  watch.reset();
  EXPECT_EQ(container.liveEnumerators(), 0U);
  container.signalAll();
  run();
}

/// Whatever happens in whatever order, the watcher's picture is right in the end.
class ContainerWatchRandomly : public ContainerWatchTest,
                               public testing::WithParamInterface<unsigned> {};

TEST_P(ContainerWatchRandomly, EndsWithTheRightPicture) {
  std::mt19937 random(GetParam());
  const auto pick = [&](unsigned below) { return static_cast<unsigned>(random() % below); };
  container.historyLimit = 6;
  container.isWorkingSet = false;
  start();
  for (int step = 0; step < 3'000; ++step) {
    switch (pick(12)) {
      case 0:
      case 1:
        container.put("k" + std::to_string(pick(30)), random());
        break;
      case 2:
        container.remove("k" + std::to_string(pick(30)));
        break;
      case 3:
        if (pick(10) == 0) container.expireAll();
        break;
      case 4:
        if (pick(20) == 0) watch->extensionDidEnd(kLost);
        break;
      case 5:
        container.openError = pick(4) == 0 ? kSignedOut : nullptr;
        break;
      case 6:
        container.changesError = pick(6) == 0 ? kLost : nullptr;
        break;
      case 7:
        container.pageError = pick(6) == 0 ? kLost : nullptr;
        break;
      case 8:
        if (pick(4) == 0)
          watcher->holds = true;
        else
          watcher->release();
        break;
      case 9:
        clock.advance(std::chrono::milliseconds(pick(200)));
        break;
      default:
        for (unsigned i = pick(6); i > 0; --i) executor.step();
    }
    ASSERT_LE(container.mostChangesInFlight, 2) << "an old life's request and a new one's";
  }
  container.openError = container.changesError = container.pageError = nullptr;
  watcher->release();
  container.put("last");
  run();
  pass(20s);
  EXPECT_TRUE(watch->isLive());
  EXPECT_FALSE(watcher->isPaused);
  EXPECT_EQ(watcher->items, container.items);
}

INSTANTIATE_TEST_SUITE_P(Seeds, ContainerWatchRandomly, testing::Range(1U, 41U));

}  // namespace
}  // namespace yomber
