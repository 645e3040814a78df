#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <functional>
#include <memory>
#include <utility>
#include <vector>

#include "platform/ostrell/errors.h"
#include "provider/testing/gate.h"
#include "provider/testing/operations_fixture.h"

namespace yomber {
namespace {

using ::testing::Contains;
using ::testing::IsEmpty;
using ::testing::Not;
using Call = ScriptedDaemon::Call;
using Capability = ScriptedContentAnswers::Capability;

class StoppingTest : public OperationsTest {
 protected:
  void answerCapabilityWith(std::uint32_t bits, const NSErrorRef& error = nullptr) {
    daemon.scriptContent([&](ScriptedContentAnswers& answers) {
      answers.capabilityToMove = [=](const std::string&, const std::string&) {
        return Capability{bits, error};
      };
    });
  }
  /// Moves the item to another container; its download is under way when this returns.
  void beginForcedDownloadOf(const std::string& identifier) {
    beginForcedDownloadOf(identifier, into(items));
  }
  void beginForcedDownloadOf(const std::string& identifier, ItemHandler handler) {
    answerCapabilityWith(QSMoveCapabilityAcrossContainers);
    addFolder(90, "elsewhere");
    daemon.hold("startProviding");
    const auto before = daemon.callCount("startProviding");
    extension->reparentItemWithIdentifier(identifier, "i:90", std::nullopt, std::move(handler));
    ASSERT_TRUE(daemon.waitForCalls("startProviding", before + 1));
  }
  void failProviding() {
    daemon.scriptContent([](ScriptedContentAnswers& answers) {
      answers.startProviding = [](const std::string&, std::uint64_t) {
        return NSError::errorWithDomain(NSCocoaErrorDomain, 4354);
      };
    });
  }
  /// A handler that does this; the gate opens when nothing of its request is left to be done.
  static ItemHandler handlerOf(const std::shared_ptr<Gate>& ended,
                               const std::function<void(const ItemAnswer&)>& what) {
    const std::shared_ptr<void> last(nullptr, [ended](void*) { ended->open(); });
    return [last, what](const NSFileProviderItemRef& item, const NSErrorRef& error) {
      what({item, error});
    };
  }
  [[nodiscard]] std::size_t refusedStops(const std::string& name) const {
    return log.count(LogLevel::Default, "[WARNING] Can't cancel download of " + inRoot(name) +
                                            " which is downloading for CZM");
  }
  void stop(const std::string& name) { extension->stopProvidingItemAtURL(urlInRoot(name)); }
  void expectNothingWasStopped() {
    EXPECT_EQ(daemon.callCount("startProviding.dropped"), 0U);
    EXPECT_EQ(daemon.callCount("evict"), 0U);
  }
};

TEST_F(StoppingTest, AStopCancelsTheRunningDownload) {
  daemon.hold("startProviding");
  extension->startProvidingItemAtURL(urlInRoot("gone.txt"), into(errors));
  ASSERT_TRUE(daemon.waitForCalls("startProviding"));
  stop("gone.txt");
  EXPECT_EQ(log.count(LogLevel::Debug, "[DEBUG] stop providing " + inRoot("gone.txt")), 1U);
  EXPECT_TRUE(daemon.waitForCalls("startProviding.dropped"));
  EXPECT_EQ(domainAndCode(only(errors)), "NSCocoaErrorDomain 3072");
  EXPECT_EQ(daemon.callCount("evict"), 0U);
  // Its end found its entry, which the stop had left there.
  EXPECT_EQ(log.countContaining("[CRIT]"), 0U);
}

TEST_F(StoppingTest, WithNothingRunningTheContentIsGivenUp) {
  makeFile("here.txt");
  stop("here.txt");
  EXPECT_THAT(daemon.calls(), Contains(Call{"evict", {inRoot("here.txt")}}));
  EXPECT_EQ(log.countContaining("[ERROR]"), 0U);
}

TEST_F(StoppingTest, AFailedEvictionIsOnlyLoggedAndPrintsTheErrorForTheURL) {
  const auto error = NSError::errorWithDomain(QSOstrellErrorDomain, QSOstrellErrorCannotEvict);
  daemon.scriptContent([&](ScriptedContentAnswers& answers) {
    answers.evict = [error](const std::string&) { return error; };
  });
  stop("nowhere.txt");
  EXPECT_EQ(log.count(LogLevel::Error, "[ERROR] can't evict item at url: " + error->description()),
            1U);
}

TEST_F(StoppingTest, WithoutALocationThereIsNothingToGiveUp) {
  extension->stopProvidingItemAtURL(nullptr);
  EXPECT_EQ(log.countContaining("[ERROR] can't evict item at url: "), 1U);
  EXPECT_EQ(daemon.callCount("evict"), 0U);
}

// ---- Downloads that a move needs ----------------------------------------------------------------

TEST_F(StoppingTest, WhatIsDownloadingForAMoveIsNotStopped) {
  addDocument(5, "moving.txt");
  beginForcedDownloadOf("d:5");
  log.forget();
  stop("moving.txt");
  EXPECT_EQ(refusedStops("moving.txt"), 1U);
  expectNothingWasStopped();
  know(5, inRoot("elsewhere/moving.txt"));
  daemon.release("startProviding");
  EXPECT_EQ(only(items).error, nullptr);
  EXPECT_TRUE(exists(inRoot("elsewhere/moving.txt")));
}

TEST_F(StoppingTest, NeitherIsTheDownloadOfSomebodyWhoReadsItMeanwhile) {
  addDocument(5, "moving.txt");
  daemon.hold("startProviding");
  extension->startProvidingItemAtURL(urlInRoot("moving.txt"), 0x20000, into(errors));
  ASSERT_TRUE(daemon.waitForCalls("startProviding"));
  beginForcedDownloadOf("d:5");
  stop("moving.txt");
  expectNothingWasStopped();
  daemon.release("startProviding");
  EXPECT_EQ(only(errors), nullptr);
  // The move's download is no entry of the table.
  EXPECT_EQ(log.countContaining("[CRIT]"), 0U);
  EXPECT_EQ(items->wait().size(), 1U);
}

TEST_F(StoppingTest, WhatIsInsideAFolderDownloadingForAMoveIsNotStopped) {
  addFolder(7, "folder");
  makeFolder("folder/below");
  beginForcedDownloadOf("i:7");
  stop("folder/below/a.txt");
  EXPECT_EQ(log.count(LogLevel::Default, "[WARNING] Can't cancel download of " +
                                             inRoot("folder/below/a.txt") +
                                             " which is inside a folder downloading for CZM"),
            1U);
  expectNothingWasStopped();
  stop("folder2");
  EXPECT_THAT(daemon.calls(), Contains(Call{"evict", {inRoot("folder2")}}));
  daemon.release("startProviding");
  EXPECT_EQ(items->wait().size(), 1U);
}

TEST_F(StoppingTest, TheFolderItselfIsNotInsideItself) {
  addFolder(7, "folder");
  beginForcedDownloadOf("i:7");
  stop("folder");
  EXPECT_THAT(daemon.calls(), Contains(Call{"evict", {inRoot("folder")}}));
  daemon.release("startProviding");
  EXPECT_EQ(items->wait().size(), 1U);
}

TEST_F(StoppingTest, ADocumentKeepsNothingButItself) {
  addDocument(5, "moving");
  beginForcedDownloadOf("d:5");
  stop("moving/below");
  stop("movin");
  EXPECT_THAT(daemon.calls(), Contains(Call{"evict", {inRoot("moving/below")}}));
  EXPECT_THAT(daemon.calls(), Contains(Call{"evict", {inRoot("movin")}}));
  daemon.release("startProviding");
  EXPECT_EQ(items->wait().size(), 1U);
}

TEST_F(StoppingTest, AnItemWhoseLocationIsNotKnownAnyMoreKeepsNothing) {
  addDocument(5, "moving.txt");
  beginForcedDownloadOf("d:5");
  daemon.script([](ScriptedDaemon::Answers& answers) {
    answers.documentLocation = [](const QSFileObjectID&) {
      return ScriptedDaemon::Location{{}, NSError::errorWithDomain(NSCocoaErrorDomain, 4)};
    };
  });
  stop("moving.txt");
  EXPECT_EQ(log.countContaining("[WARNING] Can't cancel"), 0U);
  EXPECT_THAT(daemon.calls(), Contains(Call{"evict", {inRoot("moving.txt")}}));
  daemon.release("startProviding");
  EXPECT_EQ(items->wait().size(), 1U);
}

TEST_F(StoppingTest, OnceTheMoveHasBegunStopsCountAgainBeforeItIsAnswered) {
  addDocument(5, "moving.txt");
  beginForcedDownloadOf("d:5");
  const std::string moved = inRoot("elsewhere/moving.txt");
  know(5, moved);
  daemon.hold("itemAtLocation");
  daemon.release("startProviding");
  ASSERT_TRUE(daemon.waitForCalls("itemAtLocation"));
  // The move may have come so far before the thread that began it has ended the keeping.
  EXPECT_TRUE(daemon.waitUntil([&] {
    stop("elsewhere/moving.txt");
    return daemon.callCount("evict") > 0;
  }));
  EXPECT_THAT(daemon.calls(), Contains(Call{"evict", {moved}}));
  EXPECT_TRUE(items->values().empty());
  daemon.release("itemAtLocation");
  EXPECT_EQ(only(items).error, nullptr);
}

TEST_F(StoppingTest, AFailedDownloadEndsTheKeepingAfterItIsAnswered) {
  addDocument(5, "moving.txt");
  failProviding();
  const auto ended = std::make_shared<Gate>();
  beginForcedDownloadOf("d:5", handlerOf(ended, [&](const ItemAnswer& answer) {
                          stop("moving.txt");
                          items->add(answer);
                        }));
  daemon.release("startProviding");
  EXPECT_EQ(domainAndCode(only(items).error), "NSCocoaErrorDomain 4354");
  EXPECT_EQ(refusedStops("moving.txt"), 1U);
  expectNothingWasStopped();
  ASSERT_TRUE(ended->wait());
  stop("moving.txt");
  EXPECT_EQ(daemon.callCount("evict"), 1U);
}

TEST_F(StoppingTest, OfTwoMovesOfOneItemEachKeepsItUntilItsOwnDownloadEnds) {
  addDocument(5, "moving.txt");
  failProviding();
  const auto firstEnded = std::make_shared<Gate>();
  const auto secondEnded = std::make_shared<Gate>();
  const auto secondMayEnd = std::make_shared<Gate>();
  beginForcedDownloadOf("d:5", handlerOf(firstEnded, [](const ItemAnswer&) {}));
  beginForcedDownloadOf("d:5", handlerOf(secondEnded, [secondMayEnd](const ItemAnswer&) {
                          EXPECT_TRUE(secondMayEnd->wait());
                        }));
  daemon.release("startProviding");
  ASSERT_TRUE(firstEnded->wait());
  stop("moving.txt");
  EXPECT_EQ(refusedStops("moving.txt"), 1U);
  expectNothingWasStopped();
  secondMayEnd->open();
  ASSERT_TRUE(secondEnded->wait());
  stop("moving.txt");
  EXPECT_EQ(refusedStops("moving.txt"), 1U);
  EXPECT_EQ(daemon.callCount("evict"), 1U);
}

// ---- Change notices and moves -------------------------------------------------------------------

TEST_F(StoppingTest, AChangeIsLoggedByItsURL) {
  extension->itemChangedAtURL(urlInRoot("a b.txt"));
  EXPECT_EQ(log.texts(),
            std::vector<std::string>{"[DEBUG] Item changed at URL " + textOf(inRoot("a b.txt"))});
  EXPECT_THAT(textOf(inRoot("a b.txt")), ::testing::StartsWith("file://"));
  extension->itemChangedAtURL(nullptr);
  EXPECT_EQ(log.count(LogLevel::Debug, "[DEBUG] Item changed at URL (null)"), 1U);
}

class MovingTest : public StoppingTest {
 protected:
  std::pair<bool, NSErrorRef> askAboutMove() {
    std::vector<std::pair<bool, NSErrorRef>> answers;
    extension->movingItemAtURL(urlInRoot("a"), urlInRoot("b/a"), [&](bool needs, NSErrorRef error) {
      answers.emplace_back(needs, std::move(error));
    });
    EXPECT_EQ(answers.size(), 1U) << "answered before the call returned";
    return answers.empty() ? std::pair<bool, NSErrorRef>() : answers.front();
  }
};

TEST_F(MovingTest, SixKindsOfMoveNeedTheContentAndTheOthersDoNot) {
  const auto error = NSError::errorWithDomain("SomeDomain", 5);
  for (unsigned bit = 0; bit < 32; ++bit) {
    const bool needsContent =
        bit == 1 || bit == 3 || bit == 4 || bit == 5 || bit == 10 || bit == 13;
    answerCapabilityWith(1U << bit, error);
    const auto answer = askAboutMove();
    EXPECT_EQ(answer.first, needsContent) << bit;
    EXPECT_EQ(domainAndCode(answer.second), needsContent ? "nil" : "SomeDomain 5") << bit;
  }
  EXPECT_THAT(log.lines(), IsEmpty());
  EXPECT_EQ(daemon.callCount("account"), 0U);
}

TEST_F(MovingTest, NothingIsNeededForAMoveThatIsRefusedAndItsErrorIsTheCalls) {
  answerCapabilityWith(0);
  EXPECT_EQ(askAboutMove(), (std::pair<bool, NSErrorRef>(false, nullptr)));
  answerCapabilityWith(0, qsc_errorLoggedOut());
  EXPECT_EQ(domainAndCode(askAboutMove().second), "QSOstrellErrorDomain 2");
}

TEST_F(MovingTest, BothLocationsAreTheDaemonsQuestion) {
  askAboutMove();
  EXPECT_THAT(daemon.calls(), Contains(Call{"capabilityToMove", {inRoot("a"), inRoot("b/a")}}));
  extension->movingItemAtURL(urlInRoot("a"), urlInRoot("b/a"), nullptr);
  EXPECT_EQ(daemon.callCount("capabilityToMove"), 2U);
}

}  // namespace
}  // namespace yomber
