// Which services an item has: QSFileProviderExtension::supportedServiceSourcesForItemIdentifier.

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "platform/ostrell/errors.h"
#include "provider/testing/operations_fixture.h"

namespace yomber {
namespace {

const std::string kCollaboration = "com.kelvo.PandrelCollaboration";
const std::string kSharing = "com.kelvo.Ostrell.SharingV1";

class ServiceSelectionTest : public OperationsTest {
 protected:
  std::vector<std::string> servicesOf(const std::string& identifier) {
    std::vector<std::string> names;
    NSErrorRef error = untouched;
    for (const auto& source :
         extension->supportedServiceSourcesForItemIdentifier(identifier, &error)) {
      names.push_back(source->serviceName());
    }
    EXPECT_EQ(error, untouched) << "the error is never written";
    return names;
  }
  void shareableIs(bool isShareable, const NSErrorRef& error = nullptr) {
    daemon.scriptSharing([&](ScriptedSharingAnswers& answers) {
      answers.checkIfShareable = [=, this](std::uint64_t rawID) {
        askedFor = rawID;
        return ScriptedSharingAnswers::Shareable{.isShareable = isShareable, .error = error};
      };
    });
  }
  [[nodiscard]] std::size_t warnings() const { return log.countContaining("is not shareable"); }

  const NSErrorRef untouched = NSError::errorWithDomain("untouched", 1);
  std::uint64_t askedFor = 0;
};

TEST_F(ServiceSelectionTest, ADocumentHasCollaborationThenSharing) {
  addDocument(5, "five.txt");
  EXPECT_EQ(servicesOf("d:5"), (std::vector<std::string>{kCollaboration, kSharing}));
  EXPECT_EQ(daemon.callCount("checkIfShareable"), 0U);
  EXPECT_EQ(log.countContaining("alias file key"), 0U);
}

TEST_F(ServiceSelectionTest, EachCallMakesNewSources) {
  addDocument(5, "five.txt");
  const auto first = extension->supportedServiceSourcesForItemIdentifier("d:5");
  const auto second = extension->supportedServiceSourcesForItemIdentifier("d:5");
  ASSERT_EQ(first.size(), 2U);
  ASSERT_EQ(second.size(), 2U);
  EXPECT_NE(first[0], second[0]);
  EXPECT_NE(first[1], second[1]);
  EXPECT_EQ(first[0].use_count(), 1) << "nothing else keeps it";
}

TEST_F(ServiceSelectionTest, ABookmarkHasNone) {
  ItemFields bookmark = scriptedDocument(6, "six");
  bookmark.kind = ItemKind::Bookmark;
  daemon.addItem(bookmark, inRoot("six"));
  EXPECT_EQ(servicesOf("d:6"), std::vector<std::string>{});
  EXPECT_EQ(log.count(LogLevel::Debug, "[DEBUG] Not allowing sharing of " + inRoot("six") +
                                           " because it's a fendle bookmark"),
            1U);
}

TEST_F(ServiceSelectionTest, ADocumentWhoseAliasKeyCannotBeReadHasBoth) {
  addDocument(5, "five.txt");
  std::filesystem::remove(inRoot("five.txt"));
  const auto failure = qsc_errorInvalidParameter("key", "none");
  daemon.script([&](ScriptedDaemon::Answers& answers) {
    answers.itemAtLocation = [failure](const std::string&, bool) {
      return ScriptedDaemon::Item{.item = {}, .error = failure};
    };
  });
  EXPECT_EQ(servicesOf("d:5"), (std::vector<std::string>{kCollaboration, kSharing}));
  EXPECT_EQ(log.countContaining("[ERROR] Failed to get alias file key at " + inRoot("five.txt") +
                                " - Error Domain="),
            1U);
}

TEST_F(ServiceSelectionTest, ADocumentWithoutALocationHasBoth) {
  EXPECT_EQ(servicesOf("d:404"), (std::vector<std::string>{kCollaboration, kSharing}));
  EXPECT_EQ(log.count(LogLevel::Error, "[ERROR] Failed to get alias file key at (null) - (null)"),
            1U);
}

TEST_F(ServiceSelectionTest, AFolderThatCanBeSharedHasSharingOnly) {
  shareableIs(true);
  EXPECT_EQ(servicesOf("i:7"), std::vector<std::string>{kSharing});
  EXPECT_EQ(askedFor, 7U);
  EXPECT_EQ(warnings(), 0U);
}

TEST_F(ServiceSelectionTest, AFolderThatCannotBeSharedHasNone) {
  shareableIs(false);
  EXPECT_EQ(servicesOf("i:7"), std::vector<std::string>{});
  EXPECT_EQ(log.count(LogLevel::Default, "[WARNING] i:7 is not shareable - (null)"), 1U);
}

TEST_F(ServiceSelectionTest, TheDaemonsReasonIsInTheWarning) {
  shareableIs(false, NSError::errorWithDomain("why", 3));
  EXPECT_EQ(servicesOf("i:7"), std::vector<std::string>{});
  EXPECT_EQ(warnings(), 1U);
  EXPECT_EQ(log.countContaining("i:7 is not shareable - (null)"), 0U);
}

TEST_F(ServiceSelectionTest, WithoutADaemonAFolderHasNone) {
  daemon.stop();
  EXPECT_EQ(servicesOf("i:7"), std::vector<std::string>{});
  EXPECT_EQ(warnings(), 1U);
  EXPECT_EQ(log.countContaining("i:7 is not shareable - (null)"), 0U);
}

TEST_F(ServiceSelectionTest, OnlyTheFirstCharacterOfAFoldersIdentifierCounts) {
  shareableIs(true);
  EXPECT_EQ(servicesOf("i"), std::vector<std::string>{kSharing});
  EXPECT_EQ(askedFor, 0U) << "an identifier that names nothing has the id 0";
}

TEST_F(ServiceSelectionTest, EverythingElseHasNone) {
  for (const std::string& identifier :
       {NSFileProviderRootContainerItemIdentifier, NSFileProviderWorkingSetContainerItemIdentifier,
        std::string("a:5"), std::string("D:5"), std::string()}) {
    EXPECT_EQ(servicesOf(identifier), std::vector<std::string>{}) << identifier;
  }
  EXPECT_EQ(daemon.callCount("checkIfShareable"), 0U);
  EXPECT_EQ(warnings(), 0U);
}

}  // namespace
}  // namespace yomber
