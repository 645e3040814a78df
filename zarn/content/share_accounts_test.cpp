#include "zarn/content/shares.h"
#include "zarn/content/test_sharing.h"

namespace yomber {
namespace {

using Names = std::vector<std::string>;

/// One home, on which several accounts sign in one after the other.
class ShareAccountsTest : public TwoDrives {
 protected:
  void signIn(const SharingDrive& drive, const std::string& account) const {
    drive.engine->setStore(std::make_shared<ContentStore>(records, account), account);
  }
};

TEST_F(ShareAccountsTest, WhatAnotherAccountPutsIntoASharedFolderIsItsOwn) {
  shareFolder(editor("bob"));
  signIn(*bob, "carol");
  bob->write("Plans/carols.txt", "by carol");
  bob->settle();
  const std::uint64_t carols = bob->id("Plans/carols.txt");
  EXPECT_EQ(zonesWith("carol", carols), Names{QSUbiquitousDefaultContainerID});
  EXPECT_EQ(zonesWith("carol", carols, RZDatabaseScope::Shared), Names{});
  signIn(*bob, "bob");
  bob->settle();
  ASSERT_EQ(bob->follow(), nullptr);
  ASSERT_EQ(ann->follow(), nullptr);
  EXPECT_EQ(ann->names("Plans"), (Names{"Old", "a.txt"})) << "carol has shared it with nobody";
  EXPECT_EQ(bob->read("Plans/carols.txt"), "by carol");
}

TEST_F(ShareAccountsTest, AParticipantsFoldersAreSavedUnderHisAccountOnly) {
  shareFolder(editor("bob"));
  ann->share("Plans", {editor("bob"), editor("carol")});
  signIn(*bob, "carol");
  RZShareRef accepted;
  const RZDatabaseID database{QSUbiquitousRozzelContainerIdentifier, "carol"};
  ASSERT_EQ(records->acceptShare(database.containerIdentifier, "carol", share->URL().value_or(""),
                                 accepted),
            nullptr);
  bob->rename("Plans/Old", "Plans/Older");
  bob->makeFolder("Plans/New");
  bob->settle();
  ASSERT_EQ(ann->follow(), nullptr);
  EXPECT_EQ(ann->names("Plans"), (Names{"Old", "a.txt"})) << "carol does not follow it here";
  signIn(*bob, "bob");
  bob->settle();
  ASSERT_EQ(ann->follow(), nullptr);
  EXPECT_EQ(ann->names("Plans"), (Names{"New", "Older", "a.txt"}));
}

TEST_F(ShareAccountsTest, NobodySharesWhatAnotherAccountShares) {
  shareFolder(editor("bob"));
  signIn(*ann, "carol");
  RZShareRef made;
  for (const char* path : {"Plans", "Plans/Old"}) {
    const NSErrorRef error = ann->shares().newShare(ann->at(path), made);
    ASSERT_NE(error, nullptr) << path;
    EXPECT_NE(error->localizedDescription().find("\"ann\"; sign in to that one"), std::string::npos)
        << error->description();
  }
  const RZShare own(share->recordID(), share->type(), "Plans", "carol");
  EXPECT_NE(ann->shares().save(own, made), nullptr);
  ASSERT_EQ(ann->follow(), nullptr);
  signIn(*ann, "ann");
  ann->write("Plans/more.txt", "more");
  ann->settle();
  ASSERT_EQ(bob->follow(), nullptr);
  EXPECT_EQ(bob->readWhole("Plans/more.txt"), "more");
}

TEST_F(ShareAccountsTest, AFolderThatHoldsAnotherAccountsShareIsNotShared) {
  ann->makeFolder("Top");
  ann->makeFolder("Top/Plans");
  ann->settle();
  ASSERT_NE(ann->share("Top/Plans", {viewer("bob")}), nullptr);
  signIn(*ann, "carol");
  EXPECT_NE(ann->shares().checkShareable(ann->id("Top")), nullptr);
}

TEST_F(ShareAccountsTest, WhatArrivesWhileAnotherAccountSignsInIsTheParticipants) {
  shareFolder(editor("bob"));
  ann->write("Plans/new.txt", kLong);
  ann->settle();
  meanwhile("zarn.pull.fetched", [&] { signIn(*bob, "carol"); });
  ASSERT_TRUE(bob->exists("Plans/new.txt"));
  signIn(*bob, "bob");
  bob->settle();
  EXPECT_EQ(bob->readWhole("Plans/new.txt"), kLong);
  EXPECT_EQ(zonesWith("carol", bob->id("Plans/new.txt")), Names{});
}

}  // namespace
}  // namespace yomber
