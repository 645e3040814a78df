// What the store has lost, or has no room for, of what is shared.
#include "platform/rozzel/test_store.h"
#include "zarn/content/test_sharing.h"

namespace yomber {
namespace {

class ShareStoreLossesTest : public TwoDrives {
 protected:
  [[nodiscard]] static bool isConfirmed(const SharingDrive& drive, const std::string& path) {
    const auto state = drive.engine->contentState(drive.at(path));
    return state && state->upload == ContentState::Upload::Confirmed;
  }
  [[nodiscard]] static bool isOverQuota(const SharingDrive& drive, const std::string& path) {
    const auto state = drive.engine->contentState(drive.at(path));
    return state && state->lastFailure &&
           state->lastFailure->is(NSCocoaErrorDomain, NSUbiquitousFileNotUploadedDueToQuotaError);
  }
};

TEST_F(ShareStoreLossesTest, ContentThatTheStoreHasLostGoesThereAgainWhenItsFolderIsShared) {
  ann->makeFolder("Plans");
  ann->write("Plans/a.txt", kLong);
  ann->settle();
  for (const auto& each : std::filesystem::recursive_directory_iterator(storePath + "/assets")) {
    if (each.is_regular_file()) std::filesystem::remove(each.path());
  }
  share = ann->share("Plans", {viewer("bob")});
  ASSERT_NE(share, nullptr);
  const std::vector<std::string> zone{share->recordID().zoneID().zoneName()};
  ASSERT_TRUE(waitUntil([&] { return zonesWith("ann", ann->id("Plans/a.txt")) == zone; }));
  ASSERT_EQ(bob->accept(share), nullptr);
  EXPECT_EQ(bob->readWhole("Plans/a.txt"), kLong);
}

TEST_F(ShareStoreLossesTest, WhatWasInAShareWhoseZoneIsGoneIsItsOwnersAlone) {
  shareFolder(editor("bob"));
  const std::uint64_t id = ann->id("Plans/a.txt");
  ann->engine->stop();
  ASSERT_EQ(records->deleteZone({QSUbiquitousRozzelContainerIdentifier, "ann"},
                                share->recordID().zoneID()),
            nullptr);
  ann->restart();
  (void)ann->follow();
  ann->settle();
  EXPECT_TRUE(isConfirmed(*ann, "Plans/a.txt"));
  EXPECT_EQ(zonesWith("ann", id), std::vector<std::string>{QSUbiquitousDefaultContainerID});
  EXPECT_EQ(ann->readWhole("Plans/a.txt"), kLong);
}

TEST_F(ShareStoreLossesTest, ADamagedRecordKeepsNothingElseFromComing) {
  ann->makeFolder("Plans");
  for (const std::string name : {"a.txt", "b.txt", "c.txt"}) ann->write("Plans/" + name, kLong);
  ann->settle();
  share = ann->share("Plans", {viewer("bob")});
  ASSERT_NE(share, nullptr);
  ann->settle();
  const std::uint64_t id = ann->id("Plans/b.txt");
  ann->engine->stop();
  damageRecord(storePath, std::to_string(id));
  ASSERT_EQ(bob->accept(share), nullptr);
  EXPECT_EQ(bob->readWhole("Plans/a.txt"), kLong);
  EXPECT_EQ(bob->readWhole("Plans/c.txt"), kLong);
  EXPECT_FALSE(std::filesystem::exists(bob->at("Plans/b.txt")));
  // Whose document it is saves it anew.
  ann->restart();
  ann->write("Plans/b.txt", kLong + "more");
  ann->settle();
  ASSERT_EQ(bob->follow(), nullptr);
  EXPECT_EQ(bob->readWhole("Plans/b.txt"), kLong + "more");
}

TEST_F(ShareStoreLossesTest, RoomIsAskedOfWhoseShareItIs) {
  shareFolder(editor("bob"));
  ASSERT_EQ(records->setQuota("ann", 1), nullptr);
  bob->write("Plans/more.txt", kLong + kLong);
  ASSERT_EQ(bob->scanner->scanAll(), nullptr);
  ASSERT_TRUE(waitUntil([&] { return isOverQuota(*bob, "Plans/more.txt"); }));
  ASSERT_EQ(records->setQuota("bob", 1), nullptr);
  ASSERT_EQ(records->setQuota("ann", std::nullopt), nullptr);
  bob->engine->retryNow();
  EXPECT_TRUE(waitUntil([&] { return isConfirmed(*bob, "Plans/more.txt"); }));
}

}  // namespace
}  // namespace yomber
