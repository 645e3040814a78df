#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "provider/testing/operations_fixture.h"

namespace yomber {
namespace {

using ::testing::Contains;
using Call = ScriptedDaemon::Call;

class RenameTest : public OperationsTest {
 protected:
  void rename(const std::string& identifier, const std::string& name) {
    extension->renameItemWithIdentifier(identifier, name, into(items));
  }
};

TEST_F(RenameTest, AFileIsRenamedAndDescribedAfterAScan) {
  const std::string source = addDocument(5, "old.txt");
  const std::string target = inRoot("new.txt");
  daemon.hold("itemAtLocation");
  rename("d:5", "new.txt");
  EXPECT_TRUE(isClosed("[DEBUG] ┏# renaming d:5 to new.txt"));
  know(5, target);
  ASSERT_TRUE(daemon.waitForCalls("itemAtLocation"));
  EXPECT_TRUE(items->values().empty());
  daemon.release("itemAtLocation");
  (void)items->wait();
  EXPECT_FALSE(exists(source));
  EXPECT_EQ(contentOf(target), "content");
  EXPECT_THAT(daemon.calls(), Contains(Call{"itemAtLocation", {target, "true"}}));
  expectLines({"[DEBUG] ┏# renaming d:5 to new.txt", "[DEBUG] ┏# asked url for d:5",
               "[DEBUG] source URL: " + textOf(source),
               "[DEBUG] got new URL " + textOf(target) + "; (null)"});
}

TEST_F(RenameTest, TheItemIsTheAnswer) {
  addDocument(5, "old.txt");
  daemon.script([](ScriptedDaemon::Answers& answers) {
    answers.itemAtLocation = [](const std::string&, bool) {
      return ScriptedDaemon::Item{.item = scriptedDocument(5, "new.txt"), .error = nullptr};
    };
  });
  rename("d:5", "new.txt");
  const auto answer = only(items);
  EXPECT_EQ(answer.identifier(), "d:5");
  EXPECT_EQ(answer.error, nullptr);
}

TEST_F(RenameTest, TheFileIsRenamedWhereItIsOnThisDisk) {
  daemon.addItem(scriptedDocument(5, "a name that the disk cannot hold"),
                 inRoot("a name that the disk cannot hold"));
  const std::string onDisk = makeFile("short");
  daemon.scriptContent([&](ScriptedContentAnswers& answers) {
    answers.physicalLocation = [onDisk](const std::string&) {
      return ScriptedLocation{onDisk, nullptr};
    };
  });
  know(6, inRoot("new"));
  rename("d:5", "new");
  EXPECT_EQ(only(items).identifier(), "d:6");
  EXPECT_FALSE(exists(onDisk));
  EXPECT_TRUE(exists(inRoot("new")));
  EXPECT_THAT(daemon.calls(),
              Contains(Call{"physicalLocation", {inRoot("a name that the disk cannot hold")}}));
}

TEST_F(RenameTest, OfABookmarkTheTargetIsRenamed) {
  const std::string target = addFolder(7, "target");
  daemon.addItem(scriptedDocument(6, "bookmark"), makeLink("bookmark", target));
  daemon.addItem(scriptedFolder(7, "renamed"), inRoot("renamed"));
  rename("d:6", "renamed");
  EXPECT_EQ(only(items).identifier(), "i:7");
  EXPECT_TRUE(exists(inRoot("renamed")));
  EXPECT_TRUE(exists(inRoot("bookmark")));
}

TEST_F(RenameTest, AnUnknownItemIsMissingAndItsURLIsLoggedAsNull) {
  rename("d:404", "new.txt");
  ASSERT_EQ(items->values().size(), 1U);
  EXPECT_EQ(missingIdentifier(only(items).error), "d:404");
  EXPECT_EQ(only(items).item, nullptr);
  expectLines({"[DEBUG] ┏# renaming d:404 to new.txt", "[DEBUG] source URL: (null)"});
}

TEST_F(RenameTest, AClashCarriesTheItemInTheWay) {
  addDocument(5, "old.txt");
  addDocument(6, "taken.txt", "taken");
  rename("d:5", "taken.txt");
  const auto answer = only(items);
  EXPECT_EQ(answer.item, nullptr);
  ASSERT_EQ(domainAndCode(answer.error), "NSFileProviderErrorDomain -1001");
  EXPECT_TRUE(answer.error->userInfo().contains(NSFileProviderErrorItemKey));
  EXPECT_EQ(contentOf(inRoot("taken.txt")), "taken");
  EXPECT_TRUE(exists(inRoot("old.txt")));
}

TEST_F(RenameTest, AnotherFailureIsAnsweredAsItIs) {
  addDocument(5, "old.txt");
  rename("d:5", "a/b");
  EXPECT_EQ(domainAndCode(only(items).error), "NSCocoaErrorDomain 514");
  EXPECT_EQ(log.countContaining("[DEBUG] got new URL (null); "), 1U);
}

TEST_F(RenameTest, ARenamedItemThatCannotBeLookedUpAnswersWhy) {
  addDocument(5, "old.txt");
  failLookupsWith(NSError::errorWithDomain(NSCocoaErrorDomain, 4354));
  rename("d:5", "new.txt");
  const auto answer = only(items);
  EXPECT_EQ(answer.item, nullptr);
  EXPECT_EQ(domainAndCode(answer.error), "NSFileProviderErrorDomain -1003");
  EXPECT_TRUE(exists(inRoot("new.txt")));
}

TEST_F(RenameTest, HandlersMayBeEmpty) {
  addDocument(5, "old.txt");
  addDocument(6, "taken.txt");
  extension->renameItemWithIdentifier("d:404", "new.txt", nullptr);
  extension->renameItemWithIdentifier("d:5", "taken.txt", nullptr);
  EXPECT_TRUE(daemon.waitForCalls("itemAtLocation", 1));
  extension->renameItemWithIdentifier("d:5", "new.txt", nullptr);
  EXPECT_TRUE(log.waitFor(LogLevel::Debug,
                          "[DEBUG] got new URL " + textOf(inRoot("new.txt")) + "; (null)"));
  EXPECT_TRUE(daemon.waitForCalls("itemAtLocation", 2));
}

}  // namespace
}  // namespace yomber
