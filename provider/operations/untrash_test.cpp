#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "platform/ostrell/trash_info.h"
#include "provider/testing/operations_fixture.h"

namespace yomber {
namespace {

using ::testing::Contains;
using Call = ScriptedDaemon::Call;

constexpr const char* kFallback = "[DEBUG] couldn't use putback url, fallback to default container";

class UntrashTest : public OperationsTest {
 protected:
  UntrashTest() {
    trashed = addTrashed(5, "old.txt");
    daemon.script([](ScriptedDaemon::Answers& answers) {
      // Wherever it is put, it is the item d:5.
      answers.itemAtLocation = [](const std::string&, bool) {
        return ScriptedDaemon::Item{.item = scriptedDocument(5, "old.txt"), .error = nullptr};
      };
    });
    log.forget();
  }
  void untrash(const std::optional<std::string>& parent = std::nullopt) {
    extension->untrashItemWithIdentifier("d:5", parent, into(items));
  }
  void answerPutBackWith(const ScriptedLocation& location) {
    daemon.scriptContent([&](ScriptedContentAnswers& answers) {
      answers.putBackLocation = [location](const std::string&) { return location; };
    });
  }
  void expectPutBackTo(const std::string& path) {
    const auto answer = only(items);
    EXPECT_EQ(answer.identifier(), "d:5");
    EXPECT_EQ(answer.error, nullptr);
    EXPECT_EQ(contentOf(path), "trashed");
    EXPECT_FALSE(exists(trashed));
  }

  std::string trashed;
};

TEST_F(UntrashTest, AGivenFolderIsTheDestinationAndThePutBackLocationNeverAsked) {
  addFolder(7, "folder");
  untrash("i:7");
  expectPutBackTo(inRoot("folder/old.txt"));
  EXPECT_EQ(daemon.callCount("putBackLocation"), 0U);
  EXPECT_THAT(daemon.calls(), Contains(Call{"itemAtLocation", {inRoot("folder/old.txt"), "true"}}));
  expectLines({"[DEBUG] ┏# untrashing item d:5", "[DEBUG] ┏# asked url for d:5",
               "[DEBUG] untrashing from url: " + textOf(trashed), "[DEBUG] ┏# asked url for i:7",
               "[DEBUG] untrashing item to " + textOf(inRoot("folder")),
               "[DEBUG] item was untrashed to " + textOf(inRoot("folder/old.txt"))});
}

TEST_F(UntrashTest, TheSectionClosesWhenTheCallReturns) {
  addFolder(7, "folder");
  daemon.hold("itemAtLocation");
  untrash("i:7");
  EXPECT_TRUE(isClosed("[DEBUG] ┏# untrashing item d:5"));
  ASSERT_TRUE(daemon.waitForCalls("itemAtLocation"));
  EXPECT_TRUE(items->values().empty());
  daemon.release("itemAtLocation");
  EXPECT_EQ(only(items).identifier(), "d:5");
}

TEST_F(UntrashTest, WithoutAFolderItGoesBackToWhereItCameFrom) {
  makeFolder("origin");
  answerPutBackWith({inRoot("origin/old.txt"), nullptr});
  untrash();
  expectPutBackTo(inRoot("origin/old.txt"));
  EXPECT_EQ(log.count(LogLevel::Debug,
                      "[DEBUG] untrash with putback url: " + textOf(inRoot("origin/old.txt"))),
            1U);
  EXPECT_EQ(log.count(LogLevel::Debug, kFallback), 0U);
  EXPECT_EQ(log.count(LogLevel::Debug, "[DEBUG] untrashing item to " + textOf(inRoot("origin"))),
            1U);
}

TEST_F(UntrashTest, AFolderThatDoesNotResolveCountsAsNone) {
  makeFolder("origin");
  answerPutBackWith({inRoot("origin/old.txt"), nullptr});
  untrash("i:404");
  expectPutBackTo(inRoot("origin/old.txt"));
}

TEST_F(UntrashTest, WhenTheFolderItCameFromIsGoneItGoesToItsContainersDocuments) {
  answerPutBackWith({inRoot("gone/old.txt"), nullptr});
  untrash();
  expectPutBackTo(inRoot("old.txt"));
  EXPECT_EQ(log.count(LogLevel::Debug, kFallback), 1U);
  EXPECT_EQ(log.count(LogLevel::Debug, "[DEBUG] untrashing item to " + textOf(daemon.root())), 1U);
}

TEST_F(UntrashTest, WhenNothingIsKnownOfWhereItCameFromItGoesToItsContainersDocuments) {
  untrash();
  expectPutBackTo(inRoot("old.txt"));
  EXPECT_EQ(log.count(LogLevel::Debug, "[DEBUG] untrash with putback url: (null)"), 1U);
  EXPECT_EQ(log.count(LogLevel::Debug, kFallback), 1U);
}

TEST_F(UntrashTest, TheContainerIsTheOneItWasTrashedFrom) {
  const std::string documents = daemon.home() + "/tree/org.example.Notes/Documents";
  std::filesystem::create_directories(documents);
  daemon.addContainer({"org.example.Notes", "Notes", documents, "org.example.Notes", ""});
  std::ofstream(daemon.home() + "/tree/.Trash/info/old.txt.trashinfo")
      << trashInfoText({.path = "Notes/gone/old.txt",
                        .deletionDate = "2026-03-31T18:05:09",
                        .containerID = "org.example.Notes",
                        .pathInContainer = "gone/old.txt",
                        .kind = "document"});
  untrash();
  expectPutBackTo(documents + "/old.txt");
}

TEST_F(UntrashTest, WithNoDestinationAtAllTheParentIsMissing) {
  daemon.script([](ScriptedDaemon::Answers& answers) {
    answers.containers = [] { return std::vector<ScriptedDaemon::Container>(); };
  });
  untrash("i:404");
  ASSERT_EQ(items->values().size(), 1U);
  EXPECT_EQ(missingIdentifier(only(items).error), "i:404");
  EXPECT_TRUE(exists(trashed));
  untrash();
  EXPECT_EQ(missingIdentifier(items->wait(2).back().error), "no identifier");
}

TEST_F(UntrashTest, ATakenNameIsMadeFree) {
  makeFolder("origin");
  makeFile("origin/old.txt", "another");
  answerPutBackWith({inRoot("origin/old.txt"), nullptr});
  untrash();
  expectPutBackTo(inRoot("origin/old 2.txt"));
  EXPECT_EQ(contentOf(inRoot("origin/old.txt")), "another");
}

TEST_F(UntrashTest, AFileThatHasAnotherNameOnThisDiskIsPutBack) {
  addFolder(7, "folder");
  const std::string onDisk = inTrash("short");
  std::filesystem::rename(trashed, onDisk);
  daemon.scriptContent([&](ScriptedContentAnswers& answers) {
    answers.physicalLocation = [onDisk](const std::string&) {
      return ScriptedLocation{onDisk, nullptr};
    };
  });
  untrash("i:7");
  expectPutBackTo(inRoot("folder/old.txt"));
  EXPECT_FALSE(exists(onDisk));
  EXPECT_THAT(daemon.calls(), Contains(Call{"physicalLocation", {trashed}}));
}

TEST_F(UntrashTest, AnUnknownItemIsMissing) {
  extension->untrashItemWithIdentifier("d:404", std::nullopt, into(items));
  ASSERT_EQ(items->values().size(), 1U);
  EXPECT_EQ(missingIdentifier(only(items).error), "d:404");
}

TEST_F(UntrashTest, AFailedMoveIsLoggedAndAnswered) {
  std::filesystem::remove(trashed);
  untrash();
  const auto answer = only(items);
  EXPECT_EQ(answer.item, nullptr);
  EXPECT_EQ(domainAndCode(answer.error), "NSCocoaErrorDomain 4");
  EXPECT_EQ(log.count(LogLevel::Error,
                      "[ERROR] error untrashing item to (null): " + answer.error->description()),
            1U);
  EXPECT_EQ(log.countContaining("item was untrashed to"), 0U);
}

TEST_F(UntrashTest, AnItemThatCannotBeLookedUpAfterwardsAnswersWhy) {
  failLookupsWith(NSError::errorWithDomain(NSCocoaErrorDomain, 4354));
  untrash();
  const auto answer = only(items);
  EXPECT_EQ(answer.item, nullptr);
  EXPECT_EQ(domainAndCode(answer.error), "NSFileProviderErrorDomain -1003");
  EXPECT_TRUE(exists(inRoot("old.txt")));
}

TEST_F(UntrashTest, HandlersMayBeEmpty) {
  extension->untrashItemWithIdentifier("d:404", std::nullopt, nullptr);
  extension->untrashItemWithIdentifier("d:5", std::nullopt, nullptr);
  EXPECT_TRUE(daemon.waitForCalls("itemAtLocation"));
}

}  // namespace
}  // namespace yomber
