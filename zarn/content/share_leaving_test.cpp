#include <fcntl.h>
#include <unistd.h>

#include "zarn/content/test_sharing.h"

namespace yomber {
namespace {

using Names = std::vector<std::string>;

class ShareLeavingTest : public TwoDrives {
 protected:
  [[nodiscard]] bool hasOwnRecord(const std::string& account, std::uint64_t id) const {
    return !zonesWith(account, id).empty();
  }
  /// Takes over what others have changed, while jobs may fail still.
  [[nodiscard]] NSErrorRef refresh(const SharingDrive& drive) const {
    return drive.shares().refresh(std::string(NSFileProviderRootContainerItemIdentifier));
  }
};

TEST_F(ShareLeavingTest, WhatAParticipantMovedIntoItBeforeHeHeardStaysHis) {
  bob->write("thesis.doc", kLong);
  bob->makeFolder("Letters");
  bob->write("Letters/one.txt", "dear Ann");
  bob->settle();
  const std::uint64_t thesis = bob->id("thesis.doc");
  const std::uint64_t letter = bob->id("Letters/one.txt");
  shareFolder(editor("bob"));
  ASSERT_EQ(ann->stopSharing("Plans"), nullptr);
  bob->rename("thesis.doc", "Plans/Old/thesis.doc");
  bob->rename("Letters", "Plans/Letters");
  ASSERT_EQ(bob->scanner->scanAll(), nullptr);
  ASSERT_EQ(bob->follow(), nullptr);
  EXPECT_EQ(bob->names(), (Names{"Letters", "thesis.doc"}));
  EXPECT_EQ(bob->read("thesis.doc"), kLong);
  EXPECT_EQ(bob->read("Letters/one.txt"), "dear Ann");
  EXPECT_EQ(bob->id("thesis.doc"), thesis);
  EXPECT_EQ(bob->id("Letters/one.txt"), letter);
  EXPECT_TRUE(hasOwnRecord("bob", thesis));
  EXPECT_TRUE(hasOwnRecord("bob", letter));
}

TEST_F(ShareLeavingTest, WhatAParticipantMovedIntoItBeforeAnybodySawStaysHis) {
  bob->write("thesis.doc", kLong);
  bob->makeFolder("Letters");
  bob->write("Letters/one.txt", "dear Ann");
  bob->settle();
  const std::uint64_t thesis = bob->id("thesis.doc");
  const std::uint64_t letter = bob->id("Letters/one.txt");
  shareFolder(editor("bob"));
  ASSERT_EQ(ann->stopSharing("Plans"), nullptr);
  bob->rename("thesis.doc", "Plans/Old/draft.doc");
  bob->rename("Letters", "Plans/Post");
  ASSERT_EQ(bob->follow(), nullptr);
  EXPECT_EQ(bob->names(), (Names{"Post", "draft.doc"}));
  EXPECT_EQ(bob->read("draft.doc"), kLong);
  EXPECT_EQ(bob->read("Post/one.txt"), "dear Ann");
  EXPECT_EQ(bob->id("draft.doc"), thesis);
  EXPECT_EQ(bob->id("Post/one.txt"), letter);
}

TEST_F(ShareLeavingTest, WhatAParticipantSharesHimselfStaysShared) {
  bob->makeFolder("Mine");
  bob->write("Mine/m.txt", "mine");
  bob->settle();
  ASSERT_NE(bob->share("Mine", {viewer("ann")}), nullptr);
  shareFolder(editor("bob"));
  ASSERT_EQ(ann->stopSharing("Plans"), nullptr);
  bob->rename("Mine", "Plans/Mine");
  ASSERT_EQ(bob->scanner->scanAll(), nullptr);
  ASSERT_EQ(bob->follow(), nullptr);
  EXPECT_EQ(bob->names(), Names{"Mine"});
  EXPECT_EQ(bob->read("Mine/m.txt"), "mine");
  Shares::Copied copied;
  EXPECT_EQ(bob->shares().copyShare(bob->at("Mine"), copied), nullptr);
}

TEST_F(ShareLeavingTest, WhatNoRowKnowsIsKept) {
  shareFolder(editor("bob"));
  ASSERT_EQ(ann->stopSharing("Plans"), nullptr);
  bob->write("Plans/cache.nosync", "never synced");
  bob->makeFolder("Plans/Old/build.nosync");
  bob->write("Plans/Old/build.nosync/object", "nor this");
  bob->write("Plans/unseen.txt", "not scanned yet");
  ASSERT_EQ(bob->follow(), nullptr);
  EXPECT_EQ(bob->names(), Names{"Plans (kept copy)"});
  EXPECT_EQ(bob->names("Plans (kept copy)"), (Names{"build.nosync", "cache.nosync", "unseen.txt"}));
  EXPECT_EQ(bob->read("Plans (kept copy)/cache.nosync"), "never synced");
  EXPECT_EQ(bob->read("Plans (kept copy)/build.nosync/object"), "nor this");
  EXPECT_EQ(bob->read("Plans (kept copy)/unseen.txt"), "not scanned yet");
}

TEST_F(ShareLeavingTest, WhatIsWrittenWhileTheItemGoesIsKept) {
  shareFolder(editor("bob"));
  ASSERT_EQ(bob->readWhole("Plans/a.txt"), kLong);
  ASSERT_EQ(ann->stopSharing("Plans"), nullptr);
  meanwhile("zarn.leave.kept", [&] {
    bob->write("Plans/late.txt", "late");
    bob->write("Plans/a.txt", "changed late");
  });
  EXPECT_EQ(bob->names(), (Names{"Plans (kept copy)", "a (kept copy).txt"}));
  EXPECT_EQ(bob->read("Plans (kept copy)/late.txt"), "late");
  EXPECT_EQ(bob->read("a (kept copy).txt"), "changed late");
}

TEST_F(ShareLeavingTest, WhatIsPutIntoAnOpenFolderWhileThatIsRemovedIsKept) {
  shareFolder(editor("bob"));
  const FileDescriptor folder(
      open(bob->at("Plans/Old").c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  ASSERT_TRUE(folder);
  ASSERT_EQ(ann->stopSharing("Plans"), nullptr);
  meanwhile("zarn.leave.removing", [&] {
    const FileDescriptor file(
        openat(folder.get(), "late.txt", O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600));
    ASSERT_TRUE(file);
    ASSERT_EQ(pwrite(file.get(), "late", 4, 0), 4);
  });
  // In its folder, or without it, where another look at the share came in between.
  const bool isInFolder = bob->names() == Names{"Plans (kept copy)"};
  const std::string kept =
      isInFolder ? "Plans (kept copy)/late.txt" : std::string("late (kept copy).txt");
  EXPECT_EQ(bob->names(isInFolder ? "Plans (kept copy)" : "").size(), 1U);
  EXPECT_EQ(bob->read(kept), "late");
}

TEST_F(ShareLeavingTest, AFolderThatAnEarlierProcessTookAwayComesBackWithWhatIsInIt) {
  shareFolder(editor("bob"));
  const std::string taken = bob->layout.privateArea() + "/shares/taken-1";
  ASSERT_TRUE(std::filesystem::create_directories(taken + "/Old"));
  std::ofstream(taken + "/Old/late.txt") << "late";
  bob->restart();
  ASSERT_EQ(bob->follow(), nullptr);
  EXPECT_EQ(bob->names(), (Names{"Kept folder", "Plans"}));
  EXPECT_EQ(bob->read("Kept folder/Old/late.txt"), "late");
}

TEST_F(ShareLeavingTest, WhatIsWrittenLaterIntoADocumentThatWasOpenIsKept) {
  shareFolder(editor("bob"));
  ASSERT_EQ(bob->readWhole("Plans/a.txt"), kLong);
  ASSERT_EQ(bob->readWhole("Plans/Old/b.txt"), "short");
  ASSERT_TRUE(bob->engine->waitUntilIdle(SharingDrive::kPatience));
  const FileDescriptor writer(open(bob->at("Plans/a.txt").c_str(), O_WRONLY | O_CLOEXEC));
  const FileDescriptor reader(open(bob->at("Plans/Old/b.txt").c_str(), O_RDONLY | O_CLOEXEC));
  ASSERT_TRUE(writer && reader);
  ASSERT_EQ(ann->stopSharing("Plans"), nullptr);
  ASSERT_EQ(bob->follow(), nullptr);
  ASSERT_EQ(pwrite(writer.get(), "edited", 6, 0), 6);
  EXPECT_EQ(bob->names(), Names{"a (kept copy).txt"}) << "nothing is lost of what is only read";
  EXPECT_EQ(bob->read("a (kept copy).txt"), "edited" + kLong.substr(6));
}

TEST_F(ShareLeavingTest, ALinkInItIsNoObstacle) {
  shareFolder(editor("bob"));
  ASSERT_EQ(symlink("a.txt", bob->at("Plans/link").c_str()), 0);
  ASSERT_EQ(bob->scanner->scanAll(), nullptr);
  ASSERT_EQ(ann->stopSharing("Plans"), nullptr);
  ASSERT_EQ(bob->follow(), nullptr);
  EXPECT_EQ(bob->names(), Names{"link"});
}

TEST_F(ShareLeavingTest, WhatWasMovedOutBeforeIsTheParticipantsOwn) {
  shareFolder(editor("bob"));
  ASSERT_EQ(bob->readWhole("Plans/a.txt"), kLong);
  ASSERT_TRUE(bob->engine->waitUntilIdle(SharingDrive::kPatience));
  ASSERT_EQ(ann->stopSharing("Plans"), nullptr);
  ASSERT_EQ(FaultPoint::arm("zarn.upload.read=error"), nullptr);
  bob->rename("Plans/a.txt", "mine.txt");
  ASSERT_EQ(bob->scanner->scanAll(), nullptr);
  ASSERT_EQ(refresh(*bob), nullptr);
  EXPECT_FALSE(hasOwnRecord("bob", bob->id("mine.txt")));
  FaultPoint::disarmAll();
  // Nobody looks at the file again.
  EXPECT_TRUE(waitUntil([&] { return hasOwnRecord("bob", bob->id("mine.txt")); }));
  EXPECT_EQ(bob->names(), Names{"mine.txt"});
  EXPECT_EQ(bob->read("mine.txt"), kLong);
}

TEST_F(ShareLeavingTest, WhatWasMovedOutWithoutContentIsSavedAsTheParticipantsOwn) {
  shareFolder(editor("bob"));
  ASSERT_TRUE(bob->isFault("Plans/a.txt"));
  ASSERT_EQ(FaultPoint::arm("zarn.upload.read=error"), nullptr);
  bob->rename("Plans/a.txt", "mine.txt");
  ASSERT_EQ(bob->scanner->scanAll(), nullptr);
  ASSERT_EQ(ann->stopSharing("Plans"), nullptr);
  ASSERT_EQ(refresh(*bob), nullptr);
  FaultPoint::disarmAll();
  EXPECT_TRUE(waitUntil([&] { return hasOwnRecord("bob", bob->id("mine.txt")); }));
  EXPECT_EQ(bob->readWhole("mine.txt"), kLong);
}

TEST_F(ShareLeavingTest, WhatWasMovedOutAndHasNoContentAnywhereIsGivenUpWithAReason) {
  shareFolder(editor("bob"));
  ASSERT_TRUE(bob->isFault("Plans/a.txt"));
  ASSERT_EQ(FaultPoint::arm("zarn.upload.read=error"), nullptr);
  bob->rename("Plans/a.txt", "mine.txt");
  ASSERT_EQ(bob->scanner->scanAll(), nullptr);
  ann->remove("Plans/a.txt");
  ann->settle();
  ASSERT_EQ(refresh(*bob), nullptr);
  EmbeddedEngine collector(storePath, {.assetGraceSeconds = 0});
  RZGarbageReport report;
  ASSERT_EQ(collector.collectGarbage(report), nullptr);
  FaultPoint::disarmAll();
  bob->engine->retryNow();
  std::optional<ContentTransfer> ended;
  EXPECT_TRUE(waitUntil([&] {
    for (const ContentTransfer& each : bob->engine->transfers().transfers) {
      if (each.item == bob->id("mine.txt") && !each.isRunning && !each.nextAttempt) ended = each;
    }
    return ended.has_value();
  }));
  ASSERT_TRUE(ended);
  ASSERT_NE(ended->failure, nullptr);
  EXPECT_NE(ended->failure->localizedDescription().find("\"mine.txt\" is neither here nor"),
            std::string::npos)
      << ended->failure->description();
  EXPECT_NE(bob->provide("mine.txt"), nullptr);
  EXPECT_TRUE(bob->isFault("mine.txt")) << "it is the user's to remove";
  bob->write("other.txt", "goes on");
  bob->settle();
  const auto after = bob->engine->transfers().transfers;
  ASSERT_EQ(after.size(), 1U);
  EXPECT_FALSE(after[0].nextAttempt) << "the scan has it tried once more, and no more";
}

class ShareEndingTest : public ShareLeavingTest {
 protected:
  [[nodiscard]] std::size_t countZones(const std::string& account) const {
    std::vector<RZRecordZone> zones;
    EXPECT_EQ(records->fetchZones({QSUbiquitousRozzelContainerIdentifier, account}, zones),
              nullptr);
    return zones.size();
  }
};

TEST_F(ShareEndingTest, WhatParticipantsHaveSavedIsTakenOverBefore) {
  shareFolder(editor("bob"));
  ASSERT_EQ(bob->readWhole("Plans/a.txt"), kLong);
  bob->write("Plans/a.txt", "by bob");
  bob->write("Plans/new.txt", "new by bob");
  bob->settle();
  ASSERT_EQ(ann->stopSharing("Plans"), nullptr);
  ASSERT_EQ(ann->follow(), nullptr);
  EXPECT_EQ(ann->names("Plans"), (Names{"Old", "a.txt", "new.txt"}));
  EXPECT_EQ(ann->readWhole("Plans/a.txt"), "by bob");
  EXPECT_EQ(ann->readWhole("Plans/new.txt"), "new by bob");
  EXPECT_TRUE(hasOwnRecord("ann", ann->id("Plans/new.txt")));
  EXPECT_EQ(countZones("ann"), 1U) << "the share's zone is gone";
  ASSERT_EQ(bob->follow(), nullptr);
  EXPECT_EQ(bob->names(), Names{});
}

TEST_F(ShareEndingTest, ADocumentThatIsOpenIsWaitedFor) {
  shareFolder(editor("bob"));
  ASSERT_EQ(bob->readWhole("Plans/a.txt"), kLong);
  bob->write("Plans/a.txt", "by bob");
  bob->settle();
  {
    const std::ifstream open(ann->at("Plans/a.txt"));
    ASSERT_EQ(ann->stopSharing("Plans"), nullptr);
    ASSERT_EQ(refresh(*ann), nullptr);
    EXPECT_EQ(countZones("ann"), 2U);
    EXPECT_EQ(ann->read("Plans/a.txt"), kLong);
  }
  ASSERT_EQ(ann->follow(), nullptr);
  ASSERT_EQ(ann->follow(), nullptr);
  EXPECT_EQ(ann->readWhole("Plans/a.txt"), "by bob");
  EXPECT_EQ(countZones("ann"), 1U);
}

TEST_F(ShareEndingTest, AZoneIsNotDeletedWithARecordThatWasNotTakenOver) {
  shareFolder(editor("bob"));
  const RZRecordZoneID zone = share->recordID().zoneID();
  RZRecordBatch batch;
  batch.recordsToSave.push_back(std::make_shared<RZRecord>("Other", RZRecordID("other", zone)));
  std::vector<RZRecordRef> saved;
  ASSERT_EQ(records->modifyRecords({QSUbiquitousRozzelContainerIdentifier, "ann"}, batch, saved),
            nullptr);
  ASSERT_EQ(ann->stopSharing("Plans"), nullptr);
  ASSERT_EQ(ann->follow(), nullptr);
  EXPECT_EQ(countZones("ann"), 2U);
  EXPECT_TRUE(hasOwnRecord("ann", ann->id("Plans/a.txt")));
}

}  // namespace
}  // namespace yomber
