#include "zarn/content/shares.h"

#include <unistd.h>

#include <atomic>

#include "zarn/content/test_sharing.h"

namespace yomber {
namespace {

using Names = std::vector<std::string>;

class SharesTest : public TwoDrives {};

TEST_F(SharesTest, AnAcceptedFolderAppearsWithAllThatIsInIt) {
  shareFolder(editor("bob"));
  EXPECT_EQ(bob->names(), Names{"Plans"});
  EXPECT_EQ(bob->names("Plans"), (Names{"Old", "a.txt"}));
  EXPECT_EQ(bob->id("Plans"), ann->id("Plans"));
  EXPECT_EQ(bob->id("Plans/a.txt"), ann->id("Plans/a.txt"));
  EXPECT_TRUE(bob->isFault("Plans/a.txt"));
  EXPECT_EQ(bob->row("Plans/a.txt")->size, kLong.size());
  EXPECT_EQ(bob->row("Plans/a.txt")->mtime, ann->row("Plans/a.txt")->mtime);
  EXPECT_EQ(bob->readWhole("Plans/a.txt"), kLong);
  EXPECT_EQ(bob->readWhole("Plans/Old/b.txt"), "short");
  EXPECT_NE(bob->row("Plans")->flags & row_flag::kShared, 0U);
  EXPECT_NE(ann->row("Plans")->flags & row_flag::kShared, 0U);
}

TEST_F(SharesTest, AnAcceptedDocumentAppearsInTheRoot) {
  ann->write("note.txt", kLong);
  ann->settle();
  const auto saved = ann->share("note.txt", {viewer("bob")});
  std::string identifier;
  ASSERT_EQ(bob->accept(saved, &identifier), nullptr);
  EXPECT_EQ(identifier, "d:" + std::to_string(ann->id("note.txt")));
  EXPECT_EQ(bob->readWhole("note.txt"), kLong);
  EXPECT_EQ(bob->accept(saved, &identifier), nullptr) << "once more";
  EXPECT_EQ(bob->names(), Names{"note.txt"});
}

TEST_F(SharesTest, WhatTheOwnerChangesIsTakenOver) {
  shareFolder(viewer("bob"));
  const std::uint64_t before = bob->id("Plans/a.txt");
  ann->write("Plans/a.txt", kLong + "changed");
  ann->rename("Plans/Old/b.txt", "Plans/c.txt");
  ann->makeFolder("Plans/New");
  ann->write("Plans/New/d.txt", "new");
  ann->settle();
  ann->remove("Plans/Old");
  ann->settle();
  ASSERT_EQ(bob->follow(), nullptr);
  EXPECT_EQ(bob->names("Plans"), (Names{"New", "a.txt", "c.txt"}));
  EXPECT_EQ(bob->readWhole("Plans/a.txt"), kLong + "changed");
  EXPECT_EQ(bob->readWhole("Plans/c.txt"), "short");
  EXPECT_EQ(bob->readWhole("Plans/New/d.txt"), "new");
  EXPECT_EQ(bob->id("Plans/a.txt"), before);
}

TEST_F(SharesTest, WhatAnEditorChangesIsTakenOverByTheOwner) {
  shareFolder(editor("bob"));
  ASSERT_EQ(bob->readWhole("Plans/a.txt"), kLong);
  bob->write("Plans/a.txt", "by bob");
  bob->makeFolder("Plans/Bob");
  bob->write("Plans/Bob/mine.txt", "mine");
  bob->rename("Plans/Old/b.txt", "Plans/Bob/b.txt");
  bob->settle();
  ASSERT_EQ(ann->follow(), nullptr);
  EXPECT_EQ(ann->names("Plans"), (Names{"Bob", "Old", "a.txt"}));
  EXPECT_EQ(ann->names("Plans/Bob"), (Names{"b.txt", "mine.txt"}));
  EXPECT_EQ(ann->readWhole("Plans/a.txt"), "by bob");
  EXPECT_EQ(ann->readWhole("Plans/Bob/mine.txt"), "mine");
  EXPECT_EQ(ann->id("Plans/Bob/mine.txt"), bob->id("Plans/Bob/mine.txt"));
}

TEST_F(SharesTest, TwoWhoEditOneDocumentAtOnceLoseNothing) {
  shareFolder(editor("bob"));
  ASSERT_EQ(bob->readWhole("Plans/a.txt"), kLong);
  ann->write("Plans/a.txt", "by ann");
  ann->settle();
  bob->write("Plans/a.txt", "by bob, longer");
  ASSERT_EQ(bob->scanner->scanAll(), nullptr);
  ASSERT_EQ(bob->follow(), nullptr);
  ASSERT_EQ(bob->follow(), nullptr);
  ASSERT_EQ(ann->follow(), nullptr);
  for (const auto* drive : {ann.get(), bob.get()}) {
    EXPECT_EQ(drive->names("Plans"), (Names{"Old", "a (kept copy).txt", "a.txt"}));
    EXPECT_EQ(drive->readWhole("Plans/a.txt"), "by ann");
    EXPECT_EQ(drive->readWhole("Plans/a (kept copy).txt"), "by bob, longer");
  }
}

TEST_F(SharesTest, WhatAViewerChangesIsKeptAsideAndTheSharedContentComesBack) {
  shareFolder(viewer("bob"));
  ASSERT_EQ(bob->readWhole("Plans/a.txt"), kLong);
  ASSERT_EQ(chmod(bob->at("Plans").c_str(), 0700), 0);
  ASSERT_EQ(chmod(bob->at("Plans/a.txt").c_str(), 0600), 0);
  bob->write("Plans/a.txt", "not allowed");
  bob->write("Plans/own.txt", "nor this");
  ASSERT_EQ(bob->scanner->scanAll(), nullptr);
  EXPECT_TRUE(waitUntil([&] {
    return bob->follow() == nullptr && bob->exists("a (kept copy).txt") && bob->exists("own.txt");
  }));
  EXPECT_EQ(bob->names("Plans"), (Names{"Old", "a.txt"}));
  EXPECT_EQ(bob->readWhole("Plans/a.txt"), kLong);
  EXPECT_EQ(bob->readWhole("a (kept copy).txt"), "not allowed");
  EXPECT_EQ(bob->readWhole("own.txt"), "nor this");
  ASSERT_EQ(ann->follow(), nullptr);
  EXPECT_EQ(ann->names("Plans"), (Names{"Old", "a.txt"}));
  EXPECT_EQ(ann->readWhole("Plans/a.txt"), kLong);
}

TEST_F(SharesTest, AViewersFilesAndFoldersMayNotBeWrittenTo) {
  shareFolder(viewer("bob"));
  for (const char* path : {"Plans", "Plans/a.txt", "Plans/Old", "Plans/Old/b.txt"}) {
    struct stat status{};
    ASSERT_EQ(lstat(bob->at(path).c_str(), &status), 0) << path;
    EXPECT_EQ(status.st_mode & 0222U, 0U) << path;
  }
  EXPECT_EQ(itemCapabilities(*bob->row("Plans/a.txt")),
            std::uint32_t{NSFileProviderItemCapabilitiesAllowsReading});
  EXPECT_NE(itemCapabilities(*bob->row("Plans")) & NSFileProviderItemCapabilitiesAllowsTrashing, 0U)
      << "that is leaving the share";
  Shares::ItemOptions options;
  ASSERT_EQ(bob->shares().options("d:" + std::to_string(bob->id("Plans/a.txt")), options), nullptr);
  EXPECT_TRUE(options.isShared);
  EXPECT_FALSE(options.mayWrite);
  EXPECT_FALSE(options.isSharedItself);
  EXPECT_EQ(options.folderName, "Plans");
}

TEST_F(SharesTest, WhoBecomesAnEditorMayWrite) {
  shareFolder(viewer("bob"));
  ann->share("Plans", {editor("bob")});
  ASSERT_EQ(bob->follow(), nullptr);
  bob->write("Plans/a.txt", "now by bob");
  bob->settle();
  ASSERT_EQ(ann->follow(), nullptr);
  EXPECT_EQ(ann->readWhole("Plans/a.txt"), "now by bob");
  struct stat status{};
  ASSERT_EQ(lstat(bob->at("Plans").c_str(), &status), 0);
  EXPECT_NE(status.st_mode & 0200U, 0U);
}

TEST_F(SharesTest, WhenSharingStopsTheItemGoesAndUnsavedWorkStays) {
  shareFolder(editor("bob"));
  ASSERT_EQ(bob->readWhole("Plans/a.txt"), kLong);
  goOffline();
  bob->write("Plans/a.txt", "unsaved");
  bob->write("Plans/new.txt", "unsaved too");
  ASSERT_EQ(bob->scanner->scanAll(), nullptr);
  EXPECT_NE(bob->follow(), nullptr) << "out of reach";
  EXPECT_EQ(bob->names("Plans"), (Names{"Old", "a.txt", "new.txt"})) << "nothing changes offline";
  comeBack();
  ASSERT_EQ(ann->stopSharing("Plans"), nullptr);
  ASSERT_EQ(bob->follow(), nullptr);
  EXPECT_EQ(bob->names(), (Names{"a (kept copy).txt", "new (kept copy).txt"}));
  EXPECT_EQ(bob->readWhole("a (kept copy).txt"), "unsaved");
  EXPECT_EQ(bob->readWhole("new (kept copy).txt"), "unsaved too");
  EXPECT_EQ(ann->names("Plans"), (Names{"Old", "a.txt"}));
  EXPECT_EQ(ann->readWhole("Plans/a.txt"), kLong);
  EXPECT_EQ(ann->row("Plans")->flags & row_flag::kShared, 0U);
}

TEST_F(SharesTest, AfterSharingTheRecordsAreTheContainersAgain) {
  shareFolder(viewer("bob"));
  const std::uint64_t id = ann->id("Plans/a.txt");
  ASSERT_EQ(ann->stopSharing("Plans"), nullptr);
  ASSERT_EQ(ann->follow(), nullptr);
  std::vector<RZRecordZone> zones;
  const RZDatabaseID database{QSUbiquitousRozzelContainerIdentifier, "ann"};
  ASSERT_EQ(records->fetchZones(database, zones), nullptr);
  ASSERT_EQ(zones.size(), 1U) << "the share's zone is gone";
  std::vector<RZFetchedRecord> found;
  ASSERT_EQ(records->fetchRecords(database, {RZRecordID(std::to_string(id), zones[0].zoneID)},
                                  std::nullopt, found),
            nullptr);
  EXPECT_NE(found[0].record, nullptr);
  Shares::Copied copied;
  const NSErrorRef error = ann->shares().copyShare(ann->at("Plans"), copied);
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(QSOstrellErrorDomain, QSOstrellErrorNotShared));
}

TEST_F(SharesTest, RemovingASharedItemIsLeavingTheShare) {
  shareFolder(editor("bob"));
  bob->remove("Plans");
  ASSERT_EQ(bob->scanner->scanAll(), nullptr);
  ASSERT_EQ(bob->follow(), nullptr);
  ASSERT_EQ(bob->follow(), nullptr);
  EXPECT_EQ(bob->names(), Names{});
  ASSERT_EQ(ann->follow(), nullptr);
  EXPECT_EQ(ann->names("Plans"), (Names{"Old", "a.txt"})) << "nothing of the owner's goes";
  std::vector<RZShareRef> shares;
  ASSERT_EQ(bob->shares().sharesWithMe(shares), nullptr);
  EXPECT_TRUE(shares.empty());
}

TEST_F(SharesTest, ASharedItemsPlaceAndNameBelongToEachAccount) {
  shareFolder(editor("bob"));
  bob->makeFolder("Work");
  bob->rename("Plans", "Work/Ann's plans");
  bob->settle();
  ann->rename("Plans", "Ideas");
  ann->settle();
  ASSERT_EQ(bob->follow(), nullptr);
  ASSERT_EQ(ann->follow(), nullptr);
  EXPECT_EQ(bob->names("Work"), Names{"Ann's plans"});
  EXPECT_EQ(ann->names(), Names{"Ideas"});
  ann->write("Ideas/more.txt", "more");
  ann->settle();
  ASSERT_EQ(bob->follow(), nullptr);
  EXPECT_EQ(bob->readWhole("Work/Ann's plans/more.txt"), "more");
}

TEST_F(SharesTest, NamesThatClashAreBothKept) {
  shareFolder(editor("bob"));
  ann->write("Plans/same.txt", "ann's");
  ann->settle();
  bob->write("Plans/same.txt", "bob's");
  bob->settle();
  for (int i = 0; i < 2; ++i) {
    ASSERT_EQ(bob->follow(), nullptr);
    ASSERT_EQ(ann->follow(), nullptr);
  }
  EXPECT_EQ(ann->names("Plans"), bob->names("Plans"));
  EXPECT_EQ(ann->names("Plans").size(), 4U);
  EXPECT_EQ(bob->names("Plans").size(), 4U);
}

TEST_F(SharesTest, SharesCannotBeNested) {
  shareFolder(viewer("bob"));
  RZShareRef inner;
  const NSErrorRef below = ann->shares().newShare(ann->at("Plans/Old"), inner);
  ASSERT_NE(below, nullptr);
  EXPECT_NE(below->localizedDescription().find("shared already"), std::string::npos);
  ann->makeFolder("Top");
  ann->rename("Plans", "Top/Plans");
  ann->settle();
  EXPECT_NE(ann->shares().checkShareable(ann->id("Top")), nullptr);
  EXPECT_EQ(ann->shares().checkShareable(ann->id("Top/Plans")), nullptr);
  EXPECT_EQ(bob->shares().checkShareable(bob->id("Plans")), nullptr) << "shared with him";
}

TEST_F(SharesTest, AShareIsNotForEverybody) {
  std::unique_ptr<SharingDrive> const& eve = bob;
  ann->write("note.txt", "secret");
  ann->settle();
  const auto saved = ann->share("note.txt", {viewer("carol")});
  const NSErrorRef error = eve->accept(saved);
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(rz_isError(error, RZErrorPermissionFailure));
  std::string identifier;
  EXPECT_TRUE(
      rz_isError(eve->shares().accept("yomber-share:guessed", identifier), RZErrorUnknownItem));
  EXPECT_EQ(eve->names(), Names{});
}

TEST_F(SharesTest, OnlyItsOwnerSavesAShare) {
  shareFolder(editor("bob"));
  Shares::Copied copied;
  ASSERT_EQ(bob->shares().copyShare(bob->at("Plans/a.txt"), copied), nullptr);
  EXPECT_EQ(copied.rootPath, bob->at("Plans"));
  RZShareRef saved;
  EXPECT_TRUE(rz_isError(bob->shares().save(*copied.share, saved), RZErrorPermissionFailure));
}

/// Bob follows a document of Ann's, and makes a share of it as a program of his could.
class OwnShareOfAnothersTest : public SharesTest {
 protected:
  void SetUp() override {
    ann->write("note.txt", kLong);
    ann->settle();
    ASSERT_EQ(bob->accept(ann->share("note.txt", {editor("bob")})), nullptr);
  }
  [[nodiscard]] RZShare made() const {
    const std::string name = std::to_string(bob->id("note.txt"));
    return {RZRecordID(name, RZRecordZoneID(RZShareZonePrefix + name)), RZShareTypeDocument,
            "note.txt", "bob"};
  }
  void expectAnnToGetWhatBobWrites() {
    bob->write("note.txt", "by bob");
    bob->settle();
    EXPECT_EQ(zonesWith("bob", bob->id("note.txt")), Names{});
    ASSERT_EQ(ann->follow(), nullptr);
    EXPECT_EQ(ann->readWhole("note.txt"), "by bob");
  }
};

TEST_F(OwnShareOfAnothersTest, IsRefused) {
  RZShareRef saved;
  EXPECT_TRUE(rz_isError(bob->shares().save(made(), saved), RZErrorPermissionFailure));
  expectAnnToGetWhatBobWrites();
}

TEST_F(OwnShareOfAnothersTest, ThatIsInTheStoreDoesNotTakeTheItemFromItsOwner) {
  RZShareRef saved;
  ASSERT_EQ(records->saveShare({QSUbiquitousRozzelContainerIdentifier, "bob"}, made(), saved),
            nullptr);
  ASSERT_EQ(bob->follow(), nullptr);
  expectAnnToGetWhatBobWrites();
}

TEST_F(SharesTest, TwoThatAreSavedAtOnceAreNotNested) {
  ann->makeFolder("Plans");
  ann->makeFolder("Plans/Old");
  ann->settle();
  RZShareRef inner;
  RZShareRef outer;
  ASSERT_EQ(ann->shares().newShare(ann->at("Plans/Old"), inner), nullptr);
  ASSERT_EQ(ann->shares().newShare(ann->at("Plans"), outer), nullptr);
  const Pause pause = pauseAt("zarn.share.saved");
  NSErrorRef first;
  NSErrorRef second;
  std::thread saving([&] {
    RZShareRef saved;
    first = ann->shares().save(*inner, saved);
  });
  const bool isSaving = pause.waitUntilReached();
  std::atomic<pid_t> number = 0;
  std::thread savingToo([&] {
    number = gettid();
    RZShareRef saved;
    second = ann->shares().save(*outer, saved);
  });
  const bool isWaiting = waitUntil([&] {
    std::ifstream file("/proc/self/task/" + std::to_string(number) + "/wchan");
    std::string where;
    file >> where;
    return where.find("futex") != std::string::npos;
  });
  pause.end();
  saving.join();
  savingToo.join();
  EXPECT_TRUE(isSaving && isWaiting);
  EXPECT_EQ(first, nullptr);
  ASSERT_NE(second, nullptr);
  EXPECT_NE(second->localizedDescription().find("stop sharing that first"), std::string::npos)
      << second->description();
}

TEST_F(SharesTest, AShareIsOfItsItemsKind) {
  ann->makeFolder("Plans");
  ann->settle();
  RZShareRef made;
  ASSERT_EQ(ann->shares().newShare(ann->at("Plans"), made), nullptr);
  const RZShare other(made->rootRecordID(), RZShareTypeDocument, "Plans", "ann");
  RZShareRef saved;
  EXPECT_TRUE(rz_isError(ann->shares().save(other, saved), RZErrorInvalidArguments));
}

TEST_F(SharesTest, AStaleShareIsRefused) {
  shareFolder(viewer("bob"));
  ann->share("Plans", {viewer("bob"), viewer("carol")});
  RZShareRef saved;
  EXPECT_TRUE(rz_isError(ann->shares().save(*share, saved), RZErrorServerRecordChanged));
}

}  // namespace
}  // namespace yomber
