#include "platform/ostrell/item_additions.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "platform/ostrell/constants.h"
#include "platform/ostrell/errors.h"
#include "platform/ostrell/file_manager_additions.h"
#include "platform/ostrell/scripted_daemon.h"
#include "platform/ostrell/trash_info.h"

namespace yomber {
namespace {

using Call = ScriptedDaemon::Call;

class ItemAdditionsTest : public testing::Test {
 protected:
  NSURLRef inRoot(const std::string& name) const {
    return NSURL::fileURLWithPath(daemon.root() + "/" + name);
  }
  NSURLRef inTrash(const std::string& name) const {
    return NSURL::fileURLWithPath(tree() + "/.Trash/files/" + name);
  }
  std::string tree() const { return daemon.home() + "/tree"; }
  NSURLRef addNotesContainer() {
    auto documents = NSURL::fileURLWithPath(tree() + "/org.example.Notes/Documents");
    daemon.addContainer({"org.example.Notes", "Notes", documents->path(), "org.example.Notes", ""});
    return documents;
  }
  void rememberInTrash(const std::string& name, const std::string& containerID) const {
    const TrashInfo info{.path = name,
                         .deletionDate = "2026-03-31T18:05:09",
                         .containerID = containerID,
                         .pathInContainer = containerID.empty() ? "" : name,
                         .kind = "document"};
    std::ofstream file(tree() + "/.Trash/info/" + name + std::string(kTrashInfoSuffix));
    EXPECT_TRUE(file << trashInfoText(info));
  }
  static std::string containerOf(const NSURLRef& url) {
    const auto container = qs_ostrellContainer(url);
    return container ? container->containerID() : "nil";
  }

  ScriptedDaemon daemon;
  NSFileManager& manager = NSFileManager::defaultManager();
};

TEST_F(ItemAdditionsTest, PromisesAreWhatLiesInTheirFolder) {
  EXPECT_TRUE(qs_isPromiseURL(NSURL::fileURLWithPath(tree() + "/.Promises/d:5")));
  EXPECT_FALSE(qs_isPromiseURL(NSURL::fileURLWithPath(tree() + "/.Promises")));
  EXPECT_FALSE(qs_isPromiseURL(NSURL::fileURLWithPath(tree() + "/.Promises/../x")));
  EXPECT_FALSE(qs_isPromiseURL(inRoot("d:5")));
  EXPECT_FALSE(qs_isPromiseURL(nullptr));
}

TEST_F(ItemAdditionsTest, AParentIsAnyFolderAbove) {
  EXPECT_TRUE(qs_isParentOfURL(inRoot("a"), inRoot("a/b/c")));
  EXPECT_FALSE(qs_isParentOfURL(inRoot("a"), inRoot("a")));
  EXPECT_FALSE(qs_isParentOfURL(inRoot("a"), inRoot("ab")));
  EXPECT_FALSE(qs_isParentOfURL(inRoot("a/b"), inRoot("a")));
  EXPECT_FALSE(qs_isParentOfURL(nullptr, inRoot("a")));
  EXPECT_FALSE(qs_isParentOfURL(inRoot("a"), nullptr));
}

TEST_F(ItemAdditionsTest, TheCapabilityToMoveIsTheDaemons) {
  daemon.scriptContent([](ScriptedContentAnswers& answers) {
    answers.capabilityToMove = [](const std::string&, const std::string&) {
      return ScriptedContentAnswers::Capability{QSMoveCapabilityRefusedIntoItself,
                                                NSError::errorWithDomain(NSPOSIXErrorDomain, 22)};
    };
  });
  NSErrorRef error;
  EXPECT_EQ(qs_capabilityToMoveToURL(inRoot("a"), inRoot("a/b"), &error),
            QSMoveCapabilityRefusedIntoItself);
  ASSERT_TRUE(error);
  EXPECT_TRUE(error->is(NSPOSIXErrorDomain, 22));
  EXPECT_EQ(daemon.calls().back(),
            (Call{"capabilityToMove", {inRoot("a")->path(), inRoot("a/b")->path()}}));
  EXPECT_EQ(qs_capabilityToMoveToURL(nullptr, inRoot("a")), 0U);
}

TEST_F(ItemAdditionsTest, WithoutADaemonNoMoveIsAllowedAndTheErrorSaysWhy) {
  daemon.stop();
  NSErrorRef error;
  EXPECT_EQ(qs_capabilityToMoveToURL(inRoot("a"), inRoot("b"), &error), 0U);
  EXPECT_TRUE(error);
}

TEST_F(ItemAdditionsTest, ThePhysicalLocationIsAskedForAndFallsBackToTheLogicalOne) {
  const std::string physical = inRoot("short name")->path();
  daemon.scriptContent([&](ScriptedContentAnswers& answers) {
    answers.physicalLocation = [physical](const std::string&) {
      return ScriptedLocation{physical, nullptr};
    };
  });
  EXPECT_EQ(qs_physicalURL(inRoot("long name"))->path(), physical);
  daemon.stop();
  const auto logical = inRoot("long name");
  EXPECT_EQ(qs_physicalURL(logical), logical);
  EXPECT_EQ(qs_physicalURL(nullptr), nullptr);
}

TEST_F(ItemAdditionsTest, LocationsOutsideTheTreeAreTheirOwnPhysicalOnes) {
  const auto elsewhere = NSURL::fileURLWithPath("/etc/passwd");
  EXPECT_EQ(qs_physicalURL(elsewhere), elsewhere);
  EXPECT_EQ(daemon.callCount("physicalLocation"), 0U);
}

TEST_F(ItemAdditionsTest, SettingTagsSucceedsOrFailsWithTheDaemonsError) {
  NSErrorRef error;
  EXPECT_TRUE(qs_setTagNames(inRoot("a"), {"red"}, &error));
  EXPECT_FALSE(error);
  daemon.scriptContent([](ScriptedContentAnswers& answers) {
    answers.setTagNames = [](const std::string&, const std::vector<std::string>&) {
      return NSError::errorWithDomain(NSPOSIXErrorDomain, 28);
    };
  });
  EXPECT_FALSE(qs_setTagNames(inRoot("a"), {}, &error));
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code(), 28);
  EXPECT_FALSE(qs_setTagNames(nullptr, {}));
}

// ---- Containers --------------------------------------------------------------------------------

TEST_F(ItemAdditionsTest, TheInnermostContainerHoldsALocation) {
  const auto notes = addNotesContainer();
  EXPECT_EQ(containerOf(inRoot("a/b")), QSUbiquitousDefaultContainerID);
  EXPECT_EQ(containerOf(notes->URLByAppendingPathComponent("a")), "org.example.Notes");
  EXPECT_EQ(containerOf(notes), "org.example.Notes");
  EXPECT_EQ(containerOf(NSURL::fileURLWithPath("/etc/passwd")), "nil");
  EXPECT_EQ(containerOf(nullptr), "nil");
}

TEST_F(ItemAdditionsTest, DocumentsAndDesktopCountWhileTheirFoldersExist) {
  EXPECT_EQ(containerOf(inRoot("Documents/a")), QSUbiquitousDefaultContainerID);
  std::filesystem::create_directory(inRoot("Documents")->path());
  EXPECT_EQ(containerOf(inRoot("Documents/a")), QSUbiquitousDocumentsContainerID);
}

TEST_F(ItemAdditionsTest, ATrashedItemBelongsToTheContainerItCameFrom) {
  addNotesContainer();
  rememberInTrash("note.txt", "org.example.Notes");
  EXPECT_EQ(containerOf(inTrash("note.txt")), "org.example.Notes");
  EXPECT_EQ(containerOf(inTrash("note.txt/inside")), "org.example.Notes");
}

TEST_F(ItemAdditionsTest, ATrashedItemOfAnUnknownContainerBelongsToTheDrivesOwn) {
  rememberInTrash("foreign.txt", "");
  rememberInTrash("gone.txt", "org.example.Gone");
  for (const auto& name : {"foreign.txt", "gone.txt", "no information"}) {
    EXPECT_EQ(containerOf(inTrash(name)), QSUbiquitousDefaultContainerID) << name;
  }
}

TEST_F(ItemAdditionsTest, OfWhatOthersTrashedThePutBackLocationTellsTheContainer) {
  const std::string origin = addNotesContainer()->path() + "/gone/foreign.txt";
  rememberInTrash("foreign.txt", "");
  daemon.scriptContent([&](ScriptedContentAnswers& answers) {
    answers.putBackLocation = [origin](const std::string&) {
      return ScriptedLocation{origin, nullptr};
    };
  });
  EXPECT_EQ(containerOf(inTrash("foreign.txt")), "org.example.Notes");
}

// ---- The file manager --------------------------------------------------------------------------

TEST_F(ItemAdditionsTest, TrashingAnswersWhereTheItemIs) {
  std::ofstream(inRoot("a.txt")->path()) << "content";
  NSURLRef result;
  NSErrorRef error;
  EXPECT_TRUE(qs_trashItemAtURL(manager, inRoot("a.txt"), &result, &error));
  ASSERT_TRUE(result);
  EXPECT_EQ(result->path(), inTrash("a.txt")->path());
  EXPECT_FALSE(error);
  EXPECT_FALSE(qs_trashItemAtURL(manager, inRoot("a.txt"), &result, &error));
  EXPECT_FALSE(result);
  ASSERT_TRUE(error);
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSFileNoSuchFileError));
}

TEST_F(ItemAdditionsTest, ThePutBackLocationIsTheDaemons) {
  NSErrorRef error;
  EXPECT_FALSE(qs_putBackURLForTrashedItemAtURL(manager, inTrash("a"), &error));
  EXPECT_TRUE(error);
  const std::string origin = inRoot("gone/a")->path();
  daemon.scriptContent([&](ScriptedContentAnswers& answers) {
    answers.putBackLocation = [origin](const std::string&) {
      return ScriptedLocation{origin, nullptr};
    };
  });
  const auto url = qs_putBackURLForTrashedItemAtURL(manager, inTrash("a"));
  ASSERT_TRUE(url);
  EXPECT_EQ(url->path(), origin);
}

TEST_F(ItemAdditionsTest, EvictionFailsWithTheReason) {
  EXPECT_TRUE(evictUbiquitousItemAtURL(manager, inRoot("a")));
  daemon.scriptContent([](ScriptedContentAnswers& answers) {
    answers.evict = [](const std::string&) {
      return NSError::errorWithDomain(QSOstrellErrorDomain, QSOstrellErrorCannotEvict);
    };
  });
  NSErrorRef error;
  EXPECT_FALSE(evictUbiquitousItemAtURL(manager, inRoot("a"), &error));
  ASSERT_TRUE(error);
  EXPECT_TRUE(error->is(QSOstrellErrorDomain, QSOstrellErrorCannotEvict));
  EXPECT_FALSE(evictUbiquitousItemAtURL(manager, nullptr, &error));
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSFileNoSuchFileError));
}

TEST_F(ItemAdditionsTest, DatesAndRanksAreRecordedOnTheItem) {
  qs_setLastOpenDate(manager, NSDate::fromNanoseconds(42), inRoot("a"));
  EXPECT_EQ(daemon.calls().back(), (Call{"setLastUsedDate", {inRoot("a")->path(), "42"}}));
  qs_setFavoriteRank(manager, 7, inRoot("a"));
  EXPECT_EQ(daemon.calls().back(), (Call{"setFavoriteRank", {inRoot("a")->path(), "7"}}));
  qs_setLastOpenDate(manager, std::nullopt, nullptr);
  qs_setFavoriteRank(manager, std::nullopt, nullptr);
  EXPECT_EQ(daemon.callCount("setLastUsedDate"), 1U);
  EXPECT_EQ(daemon.callCount("setFavoriteRank"), 1U);
}

TEST(OstrellErrors, APOSIXErrorCarriesItsDescription) {
  const auto error = qs_errorWithPOSIXCode(13, "The move between those locations is invalid");
  EXPECT_TRUE(error->is(NSPOSIXErrorDomain, 13));
  EXPECT_EQ(error->localizedDescription(), "The move between those locations is invalid");
}

}  // namespace
}  // namespace yomber
