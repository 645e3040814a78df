#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <vector>

#include "platform/ostrell/errors.h"
#include "provider/testing/operations_fixture.h"

namespace yomber {
namespace {

using ::testing::Contains;
using Call = ScriptedDaemon::Call;
using Capability = ScriptedContentAnswers::Capability;

class ReparentTest : public OperationsTest {
 protected:
  ReparentTest() {
    source = addDocument(5, "moving.txt");
    addFolder(7, "folder");
    log.forget();
  }
  void answerCapabilityWith(std::uint32_t bits, const NSErrorRef& error = nullptr) {
    daemon.scriptContent([&](ScriptedContentAnswers& answers) {
      answers.capabilityToMove = [=](const std::string&, const std::string&) {
        return Capability{bits, error};
      };
    });
  }
  /// Whatever lies at a location is the item d:5.
  void answerLookupsWithTheItem() {
    daemon.script([](ScriptedDaemon::Answers& answers) {
      answers.itemAtLocation = [](const std::string&, bool) {
        return ScriptedDaemon::Item{.item = scriptedDocument(5, "moving.txt"), .error = nullptr};
      };
    });
  }
  void move(const std::optional<std::string>& newName = std::nullopt,
            const std::string& identifier = "d:5", const std::string& parent = "i:7") {
    extension->reparentItemWithIdentifier(identifier, parent, newName, into(items));
  }
  void expectNothingMoved() const {
    EXPECT_TRUE(exists(source));
    EXPECT_FALSE(exists(target));
  }

  std::string source;
  const std::string target = inRoot("folder/moving.txt");
  static constexpr const char* kOpen = "[DEBUG] ┏# reparenting d:5 under i:7";
};

TEST_F(ReparentTest, AMoveThatNeedsNothingIsMadeAtOnce) {
  answerLookupsWithTheItem();
  move();
  const auto answer = only(items);
  EXPECT_EQ(answer.identifier(), "d:5");
  EXPECT_EQ(answer.error, nullptr);
  EXPECT_FALSE(exists(source));
  EXPECT_EQ(contentOf(target), "content");
  EXPECT_THAT(daemon.calls(), Contains(Call{"capabilityToMove", {source, target}}));
  EXPECT_THAT(daemon.calls(), Contains(Call{"itemAtLocation", {target, "true"}}));
  expectLines({kOpen, "[DEBUG] ┏# asked url for d:5", "[DEBUG] ┏# asked url for i:7",
               "[DEBUG] reparenting url " + textOf(source) + " under " + textOf(inRoot("folder")),
               "[DEBUG] got new URL " + textOf(target) + "; (null)"});
}

TEST_F(ReparentTest, TheSectionClosesWhenTheCallReturns) {
  answerLookupsWithTheItem();
  daemon.hold("itemAtLocation");
  move();
  EXPECT_TRUE(isClosed(kOpen));
  ASSERT_TRUE(daemon.waitForCalls("itemAtLocation"));
  EXPECT_TRUE(items->values().empty());
  daemon.release("itemAtLocation");
  EXPECT_EQ(only(items).identifier(), "d:5");
}

TEST_F(ReparentTest, WithANewNameTheOldOneIsAskedAboutAndTheNewOneGiven) {
  answerLookupsWithTheItem();
  move("renamed.txt");
  EXPECT_EQ(only(items).identifier(), "d:5");
  EXPECT_THAT(daemon.calls(), Contains(Call{"capabilityToMove", {source, target}}));
  EXPECT_TRUE(exists(inRoot("folder/renamed.txt")));
  EXPECT_FALSE(exists(target));
}

TEST_F(ReparentTest, ABookmarkIsMovedItselfAndAParentsBookmarkLeadsToItsTarget) {
  daemon.addItem(scriptedDocument(6, "bookmark"), makeLink("bookmark", source));
  daemon.addItem(scriptedDocument(8, "folder's bookmark"),
                 makeLink("folder's bookmark", inRoot("folder")));
  answerLookupsWithTheItem();
  move(std::nullopt, "d:6", "d:8");
  (void)only(items);
  EXPECT_TRUE(exists(inRoot("folder/bookmark")));
  EXPECT_FALSE(exists(inRoot("bookmark")));
  EXPECT_TRUE(exists(source));
}

TEST_F(ReparentTest, TheFileIsMovedFromWhereItIsOnThisDisk) {
  const std::string onDisk = makeFile("short");
  std::filesystem::remove(source);
  daemon.scriptContent([&](ScriptedContentAnswers& answers) {
    answers.physicalLocation = [onDisk](const std::string&) {
      return ScriptedLocation{onDisk, nullptr};
    };
  });
  answerLookupsWithTheItem();
  move();
  EXPECT_EQ(only(items).identifier(), "d:5");
  EXPECT_TRUE(exists(target));
  EXPECT_FALSE(exists(onDisk));
}

TEST_F(ReparentTest, AnUnknownItemIsMissing) {
  move(std::nullopt, "d:404");
  ASSERT_EQ(items->values().size(), 1U);
  EXPECT_EQ(missingIdentifier(only(items).error), "d:404");
  EXPECT_EQ(daemon.callCount("capabilityToMove"), 0U);
}

TEST_F(ReparentTest, AnUnknownParentIsMissing) {
  move(std::nullopt, "d:5", "i:404");
  ASSERT_EQ(items->values().size(), 1U);
  EXPECT_EQ(missingIdentifier(only(items).error), "i:404");
  EXPECT_EQ(daemon.callCount("capabilityToMove"), 0U);
  expectNothingMoved();
}

TEST_F(ReparentTest, AClashCarriesTheItemInTheWay) {
  addDocument(6, "folder/moving.txt", "in the way");
  move();
  const auto answer = only(items);
  EXPECT_EQ(answer.item, nullptr);
  ASSERT_EQ(domainAndCode(answer.error), "NSFileProviderErrorDomain -1001");
  EXPECT_TRUE(answer.error->userInfo().contains(NSFileProviderErrorItemKey));
  EXPECT_EQ(contentOf(target), "in the way");
  EXPECT_TRUE(exists(source));
}

TEST_F(ReparentTest, AMovedItemThatCannotBeLookedUpAnswersWhy) {
  failLookupsWith(NSError::errorWithDomain(NSCocoaErrorDomain, 4354));
  move();
  const auto answer = only(items);
  EXPECT_EQ(answer.item, nullptr);
  EXPECT_EQ(domainAndCode(answer.error), "NSFileProviderErrorDomain -1003");
  EXPECT_TRUE(exists(target));
}

TEST_F(ReparentTest, AnErrorThatAnAllowedMoveCameWithStaysInTheAnswer) {
  answerCapabilityWith(QSMoveCapabilityWithinContainer, NSError::errorWithDomain("SomeDomain", 5));
  answerLookupsWithTheItem();
  move();
  const auto answer = only(items);
  EXPECT_EQ(answer.identifier(), "d:5");
  EXPECT_EQ(domainAndCode(answer.error), "SomeDomain 5");
}

// ---- Capabilities -------------------------------------------------------------------------------

class AllowedMoveTest : public ReparentTest, public ::testing::WithParamInterface<unsigned> {};

TEST_P(AllowedMoveTest, IsMadeWithoutADownload) {
  answerCapabilityWith(1U << GetParam());
  answerLookupsWithTheItem();
  move();
  EXPECT_EQ(only(items).identifier(), "d:5");
  EXPECT_TRUE(exists(target));
  EXPECT_EQ(daemon.callCount("startProviding"), 0U);
}

INSTANTIATE_TEST_SUITE_P(Bits, AllowedMoveTest, ::testing::Values(0, 6, 7, 8, 12));

class DownloadingMoveTest : public ReparentTest, public ::testing::WithParamInterface<unsigned> {};

TEST_P(DownloadingMoveTest, IsMadeAfterTheContentWasProvided) {
  answerCapabilityWith(1U << GetParam());
  answerLookupsWithTheItem();
  daemon.hold("startProviding");
  move();
  ASSERT_TRUE(daemon.waitForCalls("startProviding"));
  EXPECT_THAT(daemon.calls(), Contains(Call{"startProviding", {source, "131072"}}));
  EXPECT_TRUE(isClosed(kOpen));
  expectNothingMoved();
  EXPECT_TRUE(items->values().empty());
  daemon.release("startProviding");
  EXPECT_EQ(only(items).identifier(), "d:5");
  EXPECT_TRUE(exists(target));
  expectLines(
      {"[DEBUG] Taking coordinated read on source url " + source + " because it needs downloading",
       "[DEBUG] Finished providing " + source + " with error (null)",
       "[DEBUG] got new URL " + textOf(target) + "; (null)"});
}

INSTANTIATE_TEST_SUITE_P(Bits, DownloadingMoveTest, ::testing::Values(1, 3, 4, 5, 10, 13));

class RefusedMoveTest : public ReparentTest, public ::testing::WithParamInterface<std::uint32_t> {};

TEST_P(RefusedMoveTest, WithoutAnErrorOfTheDaemonIsInvalid) {
  answerCapabilityWith(GetParam());
  move();
  ASSERT_EQ(items->values().size(), 1U);
  const auto answer = only(items);
  EXPECT_EQ(answer.item, nullptr);
  ASSERT_EQ(domainAndCode(answer.error), "NSCocoaErrorDomain 512");
  EXPECT_EQ(answer.error->userInfo().size(), 1U);
  const auto underlying = answer.error->underlyingError();
  ASSERT_EQ(domainAndCode(underlying), "NSPOSIXErrorDomain 13");
  EXPECT_EQ(underlying->localizedDescription(), "The move between those locations is invalid");
  EXPECT_EQ(
      log.count(LogLevel::Error, "[ERROR] can't move " + textOf(source) + " to " +
                                     textOf(inRoot("folder")) + "; " + answer.error->description()),
      1U);
  expectNothingMoved();
}

INSTANTIATE_TEST_SUITE_P(Bits, RefusedMoveTest,
                         ::testing::Values(0U, 1U << 2U, 1U << 9U, 1U << 11U, 1U << 14U, ~0x35fbU));

TEST_F(ReparentTest, ARefusalWithTheDaemonsErrorAnswersItMapped) {
  const auto error = NSError::errorWithDomain(NSCocoaErrorDomain, 4354);
  answerCapabilityWith(0, error);
  move();
  EXPECT_EQ(domainAndCode(only(items).error), "NSFileProviderErrorDomain -1003");
  EXPECT_EQ(log.countContaining("[ERROR] can't move "), 1U);
  EXPECT_EQ(log.countContaining("; " + error->description()), 1U);
  expectNothingMoved();
}

TEST_F(ReparentTest, AFailedDownloadAnswersItsErrorAsItIsAndMovesNothing) {
  answerCapabilityWith(QSMoveCapabilityAcrossContainers);
  const auto error = NSError::errorWithDomain(NSCocoaErrorDomain, 4354);
  daemon.scriptContent([&](ScriptedContentAnswers& answers) {
    answers.startProviding = [error](const std::string&, std::uint64_t) { return error; };
  });
  move();
  const auto answer = only(items);
  EXPECT_EQ(answer.item, nullptr);
  EXPECT_EQ(domainAndCode(answer.error), "NSCocoaErrorDomain 4354");
  EXPECT_EQ(log.count(LogLevel::Debug, "[DEBUG] Finished providing " + source + " with error " +
                                           error->description()),
            1U);
  expectNothingMoved();
}

TEST_F(ReparentTest, MovesDownloadBesideEachOther) {
  answerCapabilityWith(QSMoveCapabilityAcrossContainers);
  answerLookupsWithTheItem();
  daemon.hold("startProviding");
  for (std::uint64_t id = 20; id < 28; ++id) {
    addDocument(id, "file" + std::to_string(id));
    move(std::nullopt, "d:" + std::to_string(id));
  }
  ASSERT_TRUE(daemon.waitForCalls("startProviding", 8));
  daemon.release("startProviding");
  EXPECT_EQ(items->wait(8).size(), 8U);
  for (std::uint64_t id = 20; id < 28; ++id) {
    EXPECT_TRUE(exists(inRoot("folder/file" + std::to_string(id))));
  }
}

TEST_F(ReparentTest, OfTwoMovesOfOneItemOneFindsItGone) {
  addFolder(8, "other");
  answerCapabilityWith(QSMoveCapabilityAcrossContainers);
  answerLookupsWithTheItem();
  daemon.hold("startProviding");
  move();
  move(std::nullopt, "d:5", "i:8");
  ASSERT_TRUE(daemon.waitForCalls("startProviding", 2));
  daemon.release("startProviding");
  const auto answers = items->wait(2);
  ASSERT_EQ(answers.size(), 2U);
  EXPECT_NE(answers[0].error == nullptr, answers[1].error == nullptr);
  EXPECT_NE(exists(target), exists(inRoot("other/moving.txt")));
}

TEST_F(ReparentTest, HandlersMayBeEmpty) {
  extension->reparentItemWithIdentifier("d:404", "i:7", std::nullopt, nullptr);
  extension->reparentItemWithIdentifier("d:5", "i:404", std::nullopt, nullptr);
  answerCapabilityWith(0);
  extension->reparentItemWithIdentifier("d:5", "i:7", std::nullopt, nullptr);
  answerCapabilityWith(QSMoveCapabilityAcrossContainers);
  extension->reparentItemWithIdentifier("d:5", "i:7", std::nullopt, nullptr);
  EXPECT_TRUE(log.waitFor(LogLevel::Debug, "[DEBUG] got new URL " + textOf(target) + "; (null)"));
  EXPECT_TRUE(daemon.waitForCalls("itemAtLocation"));
}

}  // namespace
}  // namespace yomber
