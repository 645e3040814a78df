#include <sys/xattr.h>

#include "zarn/content/shared_tree.h"
#include "zarn/content/test_sharing.h"
#include "zarn/item_attributes.h"

namespace yomber {
namespace {

using Names = std::vector<std::string>;

class ShareFollowingTest : public TwoDrives {
 protected:
  void loseBobsDatabase() {
    const TreeLayout layout = bob->layout;
    bob.reset();
    for (const char* suffix : {"", "-wal", "-shm"})
      std::filesystem::remove(layout.databasePath() + suffix);
    bob = std::make_unique<SharingDrive>(layout.home(), records, "bob");
    for (std::uint32_t count = 1; count != 0;)
      ASSERT_EQ(bob->scanner->stampSome(100, count), nullptr);
    bob->engine->didStamp();
  }
};

TEST_F(ShareFollowingTest, AShareIsFollowedOnAfterTheDatabaseWasLost) {
  shareFolder(editor("bob"));
  ASSERT_EQ(bob->readWhole("Plans/a.txt"), kLong);
  loseBobsDatabase();
  ASSERT_EQ(bob->follow(), nullptr);
  ann->write("Plans/a.txt", "by ann");
  ann->write("Plans/more.txt", "more");
  ann->settle();
  ASSERT_EQ(bob->follow(), nullptr);
  EXPECT_EQ(bob->names("Plans"), (Names{"Old", "a.txt", "more.txt"}));
  EXPECT_EQ(bob->readWhole("Plans/a.txt"), "by ann");
  EXPECT_EQ(bob->readWhole("Plans/more.txt"), "more");
  EXPECT_EQ(bob->readWhole("Plans/Old/b.txt"), "short");
  bob->write("Plans/a.txt", "by bob");
  bob->settle();
  ASSERT_EQ(ann->follow(), nullptr);
  EXPECT_EQ(ann->readWhole("Plans/a.txt"), "by bob");
}

TEST_F(ShareFollowingTest, WhatWasWrittenBeforeTheDatabaseWasLostIsKept) {
  shareFolder(editor("bob"));
  ASSERT_EQ(bob->readWhole("Plans/a.txt"), kLong);
  goOffline();  // or else it might be saved before
  bob->write("Plans/a.txt", "unsaved by bob");
  loseBobsDatabase();
  comeBack();
  ASSERT_TRUE(bob->engine->waitUntilIdle(SharingDrive::kPatience));
  // What is still being looked at, as after every start, waits for the next pass.
  EXPECT_TRUE(waitUntil(
      [&] { return bob->follow() == nullptr && bob->exists("Plans/a (kept copy).txt"); }));
  EXPECT_EQ(bob->readWhole("Plans/a.txt"), kLong);
  EXPECT_EQ(bob->readWhole("Plans/a (kept copy).txt"), "unsaved by bob");
}

TEST_F(ShareFollowingTest, WhatWasOnItsWayToTheOwnZoneWhenTheShareWasFoundIsKept) {
  shareFolder(editor("bob"));
  ASSERT_EQ(bob->readWhole("Plans/a.txt"), kLong);
  bob->write("Plans/a.txt", "unsaved by bob");
  const std::uint64_t id = bob->id("Plans/a.txt");
  const std::string uploading = storePath + "-upload";
  ASSERT_EQ(FaultPoint::arm("zarn.upload.committed=pause-until-file:" + uploading), nullptr);
  loseBobsDatabase();
  ASSERT_TRUE(waitUntil([&] { return std::filesystem::exists(uploading + ".reached"); }));
  meanwhile("zarn.pull.fetched", [&] {
    std::ofstream(uploading).put('x');
    EXPECT_TRUE(waitUntil([&] {
      bool isConfirmed = false;
      EXPECT_EQ(bob->database->read([&](Connection& connection) {
        const auto content = findContent(connection, id);
        isConfirmed = content && content->content;
      }),
                nullptr);
      return isConfirmed;
    }));
  });
  EXPECT_TRUE(waitUntil(
      [&] { return bob->follow() == nullptr && bob->exists("Plans/a (kept copy).txt"); }));
  EXPECT_EQ(bob->readWhole("Plans/a.txt"), kLong);
  EXPECT_EQ(bob->readWhole("Plans/a (kept copy).txt"), "unsaved by bob");
}

TEST_F(ShareFollowingTest, AnItemOfTheSameIdentifierIsNeverTakenForTheSharedOne) {
  ann->makeFolder("Plans");
  ann->write("Plans/a.txt", kLong);
  ann->settle();
  bob->makeFolder("Own");
  const std::string id = std::to_string(ann->id("Plans"));
  ASSERT_EQ(setxattr(bob->at("Own").c_str(), kIDAttribute, id.data(), id.size(), 0), 0);
  bob->write("Own/own.txt", "bob's");
  bob->settle();
  ASSERT_EQ(bob->id("Own"), ann->id("Plans"));
  const NSErrorRef error = bob->accept(ann->share("Plans", {editor("bob")}));
  ASSERT_NE(error, nullptr);
  EXPECT_NE(error->localizedDescription().find("remove that one, then accept again"),
            std::string::npos)
      << error->description();
  EXPECT_EQ(bob->names("Own"), Names{"own.txt"});
  bob->remove("Own");
  bob->settle();
  ASSERT_EQ(bob->follow(), nullptr);
  EXPECT_EQ(bob->readWhole("Plans/a.txt"), kLong) << "there is room for it now";
}

TEST_F(ShareFollowingTest, NamesThatLeadElsewhereAreNotFollowed) {
  SharingDrive eve(bob->layout.home() + "-eve", records, "../eve");
  eve.write("note.txt", kLong);
  eve.settle();
  RZShareRef made;
  ASSERT_EQ(eve.shares().newShare(eve.at("note.txt"), made), nullptr);
  RZShare changed = *made;
  changed.setTitle("../../outside");
  std::vector<RZShareParticipant> people = changed.participants();
  people.push_back(viewer("bob"));
  changed.setParticipants(people);
  ASSERT_EQ(eve.shares().save(changed, made), nullptr);
  ASSERT_TRUE(eve.engine->waitUntilIdle(SharingDrive::kPatience));
  ASSERT_EQ(bob->accept(made), nullptr);
  EXPECT_EQ(bob->names(), Names{"Shared item"});
  EXPECT_EQ(bob->readWhole("Shared item"), kLong);
}

TEST_F(ShareFollowingTest, AnItemThatHasItsCountedNameAlreadyIsInItsPlace) {
  bob->write("same.txt", "one");
  bob->write("same 2.txt", "two");
  const ContentCore core(bob->store, bob->scanner, {});
  const ContentStore contents(records, "bob");
  const SharedTree tree(core, contents);
  std::string name = "same.txt";
  const NSErrorRef error = tree.place(bob->at("same 2.txt"), bob->at(""), name);
  EXPECT_EQ(error, nullptr) << error->description();
  EXPECT_EQ(name, "same 2.txt");
  EXPECT_EQ(bob->read("same 2.txt"), "two");
}

TEST_F(ShareFollowingTest, AShareThatCannotBeLeftKeepsNoOtherFromBeingFollowed) {
  shareFolder(viewer("bob"));
  ASSERT_EQ(bob->readWhole("Plans/a.txt"), kLong);
  for (const char* const name : {"ended.txt", "third.txt"}) ann->write(name, kLong);
  ann->settle();
  ASSERT_EQ(bob->accept(ann->share("ended.txt", {viewer("bob")})), nullptr);
  ASSERT_EQ(FaultPoint::arm("zarn.leave.kept=error"), nullptr);
  ASSERT_EQ(ann->stopSharing("ended.txt"), nullptr);
  ASSERT_NE(bob->follow(), nullptr) << "one who asks for all hears of it";
  ASSERT_EQ(chmod(bob->at("Plans/a.txt").c_str(), 0600), 0);
  bob->write("Plans/a.txt", "not allowed");
  ASSERT_EQ(bob->scanner->scanAll(), nullptr);
  const std::string identifier = "d:" + std::to_string(bob->id("Plans/a.txt"));
  EXPECT_TRUE(waitUntil([&] {
    const NSErrorRef error = bob->shares().refresh(identifier);
    EXPECT_EQ(error, nullptr) << error->description();
    return error || bob->exists("a (kept copy).txt");
  }));
  EXPECT_EQ(bob->readWhole("Plans/a.txt"), kLong);
  EXPECT_EQ(bob->accept(ann->share("third.txt", {viewer("bob")})), nullptr);
  EXPECT_EQ(bob->readWhole("third.txt"), kLong);
  FaultPoint::disarmAll();
  ASSERT_EQ(bob->follow(), nullptr);
  EXPECT_FALSE(bob->exists("ended.txt"));
}

TEST_F(ShareFollowingTest, ASharedItemThatIsRemovedBeforeAllOfItIsHereIsLeft) {
  ann->makeFolder("Plans");
  ann->write("Plans/a.txt", kLong);
  ann->settle();
  share = ann->share("Plans", {editor("bob")});
  RZShareRef accepted;
  ASSERT_EQ(records->acceptShare(QSUbiquitousRozzelContainerIdentifier, "bob",
                                 share->URL().value_or(""), accepted),
            nullptr);
  meanwhile("zarn.pull.placed", [&] {
    ASSERT_TRUE(bob->exists("Plans"));
    bob->remove("Plans");
  });
  std::vector<RZShareRef> shares;
  for (int turn = 0; turn < 3; ++turn) ASSERT_EQ(bob->follow(), nullptr);
  ASSERT_EQ(bob->shares().sharesWithMe(shares), nullptr);
  EXPECT_TRUE(shares.empty());
  share = ann->share("Plans", {editor("bob")});
  ASSERT_EQ(bob->accept(share), nullptr);
  EXPECT_EQ(bob->readWhole("Plans/a.txt"), kLong);
  EXPECT_EQ(ann->readWhole("Plans/a.txt"), kLong);
}

TEST_F(ShareFollowingTest, NobodysSharesAreJudgedByAnotherAccountsZones) {
  shareFolder(editor("bob"));
  ASSERT_EQ(bob->readWhole("Plans/a.txt"), kLong);
  ASSERT_EQ(FaultPoint::arm("zarn.database.before-commit=error"), nullptr);
  bob->engine->setStore(std::make_shared<ContentStore>(records, "carol"), "carol");
  const NSErrorRef error =
      bob->shares().refresh(std::string(NSFileProviderRootContainerItemIdentifier));
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(QSOstrellErrorDomain, QSOstrellErrorLoggedOut)) << error->description();
  FaultPoint::disarmAll();
  bob->engine->setStore(std::make_shared<ContentStore>(records, "bob"), "bob");
  ASSERT_EQ(bob->follow(), nullptr);
  EXPECT_EQ(bob->readWhole("Plans/a.txt"), kLong);
}

}  // namespace
}  // namespace yomber
