#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "platform/fileprovider/file_operations.h"
#include "provider/testing/operations_fixture.h"

namespace yomber {
namespace {

using ::testing::Contains;
using Call = ScriptedDaemon::Call;

class TrashTest : public OperationsTest {
 protected:
  void trash(const std::string& identifier) {
    extension->trashItemWithIdentifier(identifier, into(items));
  }
  void failTrashingWith(const NSErrorRef& error) {
    daemon.scriptContent([&](ScriptedContentAnswers& answers) {
      answers.trash = [error](const std::string&) { return ScriptedLocation{{}, error}; };
    });
  }
};

TEST_F(TrashTest, AnItemGoesToTheTrashBeforeTheCallReturns) {
  const std::string source = addDocument(5, "old.txt");
  trash("d:5");
  ASSERT_EQ(items->values().size(), 1U);
  EXPECT_EQ(only(items).identifier(), "d:5");
  EXPECT_EQ(only(items).error, nullptr);
  EXPECT_FALSE(exists(source));
  EXPECT_TRUE(exists(inTrash("old.txt")));
  EXPECT_THAT(daemon.calls(), Contains(Call{"trash", {source}}));
  EXPECT_THAT(daemon.calls(), Contains(Call{"itemAtLocation", {inTrash("old.txt"), "true"}}));
  expectLines({"[DEBUG] ┏# trashing item d:5", "[DEBUG] ┏# asked url for d:5",
               "[DEBUG] trashing " + fp_obfuscatedPath(source).value()});
  EXPECT_NE(fp_obfuscatedPath(source), source);
  EXPECT_TRUE(isClosed("[DEBUG] ┏# trashing item d:5"));
}

TEST_F(TrashTest, ABookmarkIsTrashedItself) {
  const std::string target = addDocument(5, "target.txt");
  daemon.addItem(scriptedDocument(6, "bookmark"), makeLink("bookmark", target));
  trash("d:6");
  EXPECT_EQ(only(items).identifier(), "d:6");
  EXPECT_TRUE(exists(target));
  EXPECT_FALSE(exists(inRoot("bookmark")));
}

TEST_F(TrashTest, AFileThatHasAnotherNameOnThisDiskIsTrashed) {
  const std::string location = inRoot("a name that the disk cannot hold");
  daemon.addItem(scriptedDocument(5, "a name that the disk cannot hold"), location);
  const std::string onDisk = makeFile("short");
  daemon.scriptContent([&](ScriptedContentAnswers& answers) {
    answers.physicalLocation = [onDisk](const std::string&) {
      return ScriptedLocation{onDisk, nullptr};
    };
    answers.trash = [onDisk, target = inTrash("short")](const std::string&) {
      std::filesystem::rename(onDisk, target);
      return ScriptedLocation{target, nullptr};
    };
  });
  know(6, inTrash("short"));
  trash("d:5");
  EXPECT_EQ(only(items).identifier(), "d:6");
  EXPECT_EQ(only(items).error, nullptr);
  EXPECT_FALSE(exists(onDisk));
  EXPECT_THAT(daemon.calls(), Contains(Call{"physicalLocation", {location}}));
  EXPECT_THAT(daemon.calls(), Contains(Call{"trash", {location}}));
}

TEST_F(TrashTest, AnUnknownItemIsMissing) {
  trash("d:404");
  ASSERT_EQ(items->values().size(), 1U);
  EXPECT_EQ(missingIdentifier(only(items).error), "d:404");
  EXPECT_EQ(daemon.callCount("trash"), 0U);
}

TEST_F(TrashTest, AFailedCoordinationIsAnsweredAsItIs) {
  daemon.addItem(scriptedDocument(5, "gone.txt"), inRoot("gone.txt"));
  trash("d:5");
  const auto answer = only(items);
  EXPECT_EQ(answer.item, nullptr);
  EXPECT_EQ(domainAndCode(answer.error), "NSCocoaErrorDomain 4");
  EXPECT_EQ(log.count(LogLevel::Debug,
                      "[DEBUG] failed to coordinate the deletion: " + answer.error->description()),
            1U);
  EXPECT_EQ(daemon.callCount("trash"), 0U);
}

TEST_F(TrashTest, AFailureToTrashIsAnsweredUnmapped) {
  addDocument(5, "old.txt");
  failTrashingWith(NSError::errorWithDomain(NSCocoaErrorDomain, 4354));
  trash("d:5");
  const auto answer = only(items);
  EXPECT_EQ(answer.item, nullptr);
  EXPECT_EQ(domainAndCode(answer.error), "NSCocoaErrorDomain 4354");
  EXPECT_EQ(daemon.callCount("itemAtLocation"), 0U);
}

TEST_F(TrashTest, ATrashedItemThatCannotBeLookedUpAnswersWhy) {
  addDocument(5, "old.txt");
  failLookupsWith(NSError::errorWithDomain("SomeDomain", 5));
  trash("d:5");
  const auto answer = only(items);
  EXPECT_EQ(answer.item, nullptr);
  EXPECT_EQ(domainAndCode(answer.error), "SomeDomain 5");
  EXPECT_TRUE(exists(inTrash("old.txt")));
}

TEST_F(TrashTest, WithoutCoordinationTheLocationIsTheAnswer) {
  const std::string source = addDocument(5, "old.txt");
  std::vector<std::pair<NSURLRef, NSErrorRef>> answers;
  const URLHandler handler = [&](const NSURLRef& url, const NSErrorRef& error) {
    answers.emplace_back(url, error);
  };
  extension->_trashItemAtURLWithoutCoordination(NSURL::fileURLWithPath(source), handler);
  ASSERT_EQ(answers.size(), 1U);
  ASSERT_NE(answers[0].first, nullptr);
  EXPECT_EQ(answers[0].first->path(), inTrash("old.txt"));
  EXPECT_EQ(answers[0].second, nullptr);
  EXPECT_EQ(log.texts(),
            std::vector<std::string>{"[DEBUG] trashing " + fp_obfuscatedPath(source).value()});
  EXPECT_EQ(daemon.callCount("itemAtLocation"), 0U);

  failTrashingWith(NSError::errorWithDomain(NSCocoaErrorDomain, 4354));
  extension->_trashItemAtURLWithoutCoordination(NSURL::fileURLWithPath(source), handler);
  ASSERT_EQ(answers.size(), 2U);
  EXPECT_EQ(answers[1].first, nullptr);
  EXPECT_EQ(domainAndCode(answers[1].second), "NSCocoaErrorDomain 4354");
}

TEST_F(TrashTest, HandlersMayBeEmpty) {
  addDocument(5, "old.txt");
  extension->trashItemWithIdentifier("d:404", nullptr);
  extension->trashItemWithIdentifier("d:5", nullptr);
  extension->trashItemWithIdentifier("d:5", nullptr);
  extension->_trashItemAtURLWithoutCoordination(nullptr, nullptr);
  EXPECT_TRUE(exists(inTrash("old.txt")));
}

// ---- Deleting -----------------------------------------------------------------------------------

class DeleteTest : public OperationsTest {
 protected:
  void remove(const std::string& identifier) {
    extension->deleteItemWithIdentifier(identifier, into(errors));
  }
  /// What the daemon answers when it is asked where the file is on this disk, one after the other.
  void answerPhysicalLocationsWith(std::vector<std::string> paths) {
    daemon.scriptContent([&](ScriptedContentAnswers& answers) {
      answers.physicalLocation =
          [paths, next = std::make_shared<std::size_t>(0)](const std::string& path) {
            return ScriptedLocation{*next < paths.size() ? paths[(*next)++] : path, nullptr};
          };
    });
  }
};

TEST_F(DeleteTest, AnItemIsDeleted) {
  const std::string path = addDocument(5, "old.txt");
  remove("d:5");
  EXPECT_EQ(only(errors), nullptr);
  EXPECT_FALSE(exists(path));
  expectLines({"[DEBUG] ┏# deleting item d:5", "[DEBUG] ┏# asked url for d:5"});
  EXPECT_TRUE(isClosed("[DEBUG] ┏# deleting item d:5"));
  EXPECT_EQ(log.countContaining("retrying"), 0U);
}

TEST_F(DeleteTest, ABookmarkIsDeletedItself) {
  const std::string target = addFolder(7, "target");
  daemon.addItem(scriptedDocument(6, "bookmark"), makeLink("bookmark", target));
  remove("d:6");
  EXPECT_EQ(only(errors), nullptr);
  EXPECT_TRUE(exists(target));
  EXPECT_FALSE(exists(inRoot("bookmark")));
}

TEST_F(DeleteTest, AnUnknownItemIsMissing) {
  remove("d:404");
  ASSERT_EQ(errors->values().size(), 1U);
  EXPECT_EQ(missingIdentifier(only(errors)), "d:404");
}

TEST_F(DeleteTest, WhatIsGoneFromItsPlaceIsDeletedWhereItIsNow) {
  daemon.addItem(scriptedDocument(5, "logical.txt"), inRoot("logical.txt"));
  const std::string onDisk = makeFile("physical.txt");
  answerPhysicalLocationsWith({inRoot("gone.txt"), onDisk});
  remove("d:5");
  EXPECT_EQ(only(errors), nullptr);
  EXPECT_FALSE(exists(onDisk));
  EXPECT_EQ(log.count(LogLevel::Debug, "[DEBUG] couldn't delete " + textOf(inRoot("logical.txt")) +
                                           ", retrying with physical url " + textOf(onDisk)),
            1U);
}

TEST_F(DeleteTest, ItIsTriedAgainOnlyOnce) {
  daemon.addItem(scriptedDocument(5, "logical.txt"), inRoot("logical.txt"));
  remove("d:5");
  EXPECT_EQ(domainAndCode(only(errors)), "NSCocoaErrorDomain 4");
  EXPECT_EQ(log.countContaining("retrying with physical url"), 1U);
}

TEST_F(DeleteTest, AnyOtherFailureIsAnsweredWithoutASecondTry) {
  const std::string name(300, 'x');  // longer than a name on this disk can be
  daemon.addItem(scriptedDocument(5, name), inRoot(name));
  remove("d:5");
  const auto error = only(errors);
  ASSERT_NE(error, nullptr);
  EXPECT_NE(domainAndCode(error), "NSCocoaErrorDomain 4");
  EXPECT_EQ(log.countContaining("retrying"), 0U);
}

TEST_F(DeleteTest, HandlersMayBeEmpty) {
  const std::string path = addDocument(5, "old.txt");
  daemon.addItem(scriptedDocument(6, "gone.txt"), inRoot("gone.txt"));
  extension->deleteItemWithIdentifier("d:404", nullptr);
  extension->deleteItemWithIdentifier("d:6", nullptr);
  extension->deleteItemWithIdentifier("d:5", nullptr);
  EXPECT_TRUE(daemon.waitUntil([&] { return daemon.callCount("physicalLocation") >= 3; }));
}

}  // namespace
}  // namespace yomber
