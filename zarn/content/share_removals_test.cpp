#include <sys/stat.h>
#include <sys/xattr.h>

#include "platform/ostrell/constants.h"
#include "platform/rozzel/record.h"
#include "zarn/content/share_rows.h"
#include "zarn/content/test_sharing.h"
#include "zarn/item_attributes.h"

namespace yomber {
namespace {

using Names = std::vector<std::string>;

class ShareRemovalsTest : public TwoDrives {
 protected:
  /// A record of a document, as Ann saves it, in a folder that need not be there.
  void saveRecord(std::uint64_t id, std::uint64_t parent, const char* type) const {
    const auto record = std::make_shared<RZRecord>(
        type, RZRecordID(std::to_string(id), share->recordID().zoneID()));
    record->setObject(std::string("Late"), kQSRecordKeyName);
    record->setObject(static_cast<std::int64_t>(parent), kQSRecordKeyParent);
    RZRecordBatch batch;
    batch.recordsToSave.push_back(record);
    std::vector<RZRecordRef> saved;
    ASSERT_EQ(records->modifyRecords({QSUbiquitousRozzelContainerIdentifier, "ann"}, batch, saved),
              nullptr);
  }
  [[nodiscard]] bool hasUpload(const SharingDrive& drive, std::uint64_t id) const {
    bool isFound = false;
    EXPECT_EQ(drive.database->read([&](Connection& connection) {
      isFound = findJob(connection, id, JobKind::Upload).has_value();
    }),
              nullptr);
    return isFound;
  }
  [[nodiscard]] std::int64_t attemptsOf(std::uint64_t record) const {
    std::int64_t attempts = -1;
    EXPECT_EQ(bob->database->read([&](Connection& connection) {
      Statement statement(connection.database(),
                          "SELECT attempts FROM share_waiting WHERE record=?1");
      statement.bindID(1, record);
      if (statement.step()) attempts = statement.integer(0);
    }),
              nullptr);
    return attempts;
  }
};

TEST_F(ShareRemovalsTest, WhatAViewerDeletesByForceComesBack) {
  shareFolder(viewer("bob"));
  EXPECT_EQ(unlink(bob->at("Plans/a.txt").c_str()) == 0 ? 0 : errno, geteuid() == 0 ? 0 : EACCES);
  ASSERT_EQ(chmod(bob->at("Plans").c_str(), 0700), 0);
  ASSERT_EQ(chmod(bob->at("Plans/Old").c_str(), 0700), 0);
  bob->remove("Plans/a.txt");
  bob->remove("Plans/Old");
  ASSERT_EQ(bob->scanner->scanAll(), nullptr);
  EXPECT_TRUE(waitUntil([&] {
    return bob->follow() == nullptr && bob->exists("Plans/a.txt") && bob->exists("Plans/Old/b.txt");
  }));
  EXPECT_EQ(bob->readWhole("Plans/a.txt"), kLong);
  EXPECT_EQ(bob->readWhole("Plans/Old/b.txt"), "short");
  EXPECT_EQ(bob->id("Plans/a.txt"), ann->id("Plans/a.txt"));
  ASSERT_EQ(ann->follow(), nullptr);
  EXPECT_EQ(ann->names("Plans"), (Names{"Old", "a.txt"}));
}

TEST_F(ShareRemovalsTest, UnsavedWorkInAFolderThatItsOwnerDeletesIsKept) {
  shareFolder(editor("bob"));
  ASSERT_EQ(bob->readWhole("Plans/Old/b.txt"), "short");
  ann->remove("Plans/Old");
  ann->settle();
  bob->write("Plans/Old/b.txt", "unsaved by bob");
  ASSERT_EQ(bob->follow(), nullptr);
  bob->settle();
  // An upload that was refused, as its folder had just gone, is tried again a moment later.
  EXPECT_TRUE(waitUntil([&] {
    followBoth();
    return ann->exists("Plans/b (kept copy).txt");
  }));
  EXPECT_EQ(bob->names("Plans"), (Names{"a.txt", "b (kept copy).txt"}));
  EXPECT_EQ(bob->read("Plans/b (kept copy).txt"), "unsaved by bob");
  EXPECT_EQ(ann->readWhole("Plans/b (kept copy).txt"), "unsaved by bob");
}

TEST_F(ShareRemovalsTest, WhatAViewerHasInAFolderThatItsOwnerDeletesIsKeptBesideTheShare) {
  shareFolder(viewer("bob"));
  ASSERT_EQ(bob->readWhole("Plans/Old/b.txt"), "short");
  for (const char* path : {"Plans/Old", "Plans/Old/b.txt"})
    ASSERT_EQ(chmod(bob->at(path).c_str(), 0700), 0);
  bob->write("Plans/Old/b.txt", "unsaved by bob");
  bob->write("Plans/Old/own.nosync", "never synced");
  ann->remove("Plans/Old");
  ann->settle();
  followBoth();
  EXPECT_EQ(bob->names("Plans"), Names{"a.txt"});
  EXPECT_EQ(bob->names(), (Names{"Plans", "b (kept copy).txt", "own.nosync"}));
  EXPECT_EQ(bob->read("b (kept copy).txt"), "unsaved by bob");
  EXPECT_EQ(bob->read("own.nosync"), "never synced");
}

TEST_F(ShareRemovalsTest, ARecordWhoseFolderIsNotKnownIsAskedForLaterUnlessSomebodyAsks) {
  shareFolder(editor("bob"));
  const std::uint64_t folder = 4'000'000'001;
  const std::uint64_t inIt = 4'000'000'002;
  saveRecord(inIt, folder, kQSRecordTypeFolder);
  ASSERT_EQ(bob->follow(), nullptr);
  const std::int64_t first = attemptsOf(inIt);
  ASSERT_GE(first, 1);
  ASSERT_EQ(bob->accept(share), nullptr);
  EXPECT_EQ(attemptsOf(inIt), first) << "a pass that nobody asks for";
  ASSERT_EQ(bob->follow(), nullptr);
  EXPECT_EQ(attemptsOf(inIt), first + 1);
  saveRecord(folder, ann->id("Plans"), kQSRecordTypeFolder);
  ASSERT_EQ(bob->accept(share), nullptr);
  EXPECT_TRUE(bob->exists("Plans/Late/Late")) << "its folder has come";
  EXPECT_EQ(attemptsOf(inIt), -1);
}

TEST_F(ShareRemovalsTest, WhatIsRemovedBeforeItWasLookedAtIsRemovedForAll) {
  shareFolder(editor("bob"));
  addToFolder();
  meanwhile("zarn.pull.placed", [&] {
    bob->remove("Plans/new.txt");
    bob->remove("Plans/Folder");
  });
  const Names expected{"Old", "a.txt", "stays.txt"};
  EXPECT_TRUE(waitUntil([&] {
    followBoth();
    return ann->names("Plans") == expected;
  }));
  EXPECT_EQ(bob->names("Plans"), expected);
}

TEST_F(ShareRemovalsTest, WhatIsPutBackWhileItsRemovalIsTakenOverStays) {
  shareFolder(editor("bob"));
  ASSERT_EQ(bob->readWhole("Plans/a.txt"), kLong);
  const std::uint64_t id = ann->id("Plans/a.txt");
  const std::string away = ann->layout.home() + "/away";
  ASSERT_EQ(::rename(ann->at("Plans/a.txt").c_str(), away.c_str()), 0);
  ann->settle();
  const auto pass = [this] {
    (void)bob->shares().refresh(std::string(NSFileProviderRootContainerItemIdentifier));
  };
  {
    const Pause fetched = pauseAt("zarn.pull.fetched");
    std::thread following(pass);
    EXPECT_TRUE(fetched.waitUntilReached());
    EXPECT_EQ(::rename(away.c_str(), ann->at("Plans/a.txt").c_str()), 0);
    ann->settle();
    const Pause removing = pauseAt("zarn.upload.committed");
    const Pause placed = pauseAt("zarn.pull.placed");
    fetched.end();
    EXPECT_TRUE(placed.waitUntilReached());
    // A removal that was begun ends after the item has come again.
    EXPECT_TRUE(waitUntil([&] { return removing.isReached() || !hasUpload(*bob, id); }));
    placed.end();
    following.join();
    FaultPoint::disarmAll();
    const Pause known = pauseAt("zarn.pull.stored");
    std::thread followingOn(pass);
    EXPECT_TRUE(known.waitUntilReached());
    removing.end();
    EXPECT_TRUE(bob->engine->waitUntilIdle(SharingDrive::kPatience));
    known.end();
    followingOn.join();
  }
  FaultPoint::disarmAll();
  followBoth();
  EXPECT_EQ(ann->names("Plans"), (Names{"Old", "a.txt"}));
  EXPECT_EQ(bob->names("Plans"), (Names{"Old", "a.txt"}));
  EXPECT_EQ(bob->readWhole("Plans/a.txt"), kLong);
}

TEST_F(ShareRemovalsTest, WhatIsRemovedAndPutBackBeforeItsPageIsDoneStays) {
  shareFolder(editor("bob"));
  ann->write("Plans/new.txt", kLong);
  ann->settle();
  const std::string away = ann->layout.home() + "/away";
  meanwhile("zarn.pull.placed", [&] {
    bob->settle();
    bob->remove("Plans/new.txt");
    bob->settle();
    ASSERT_EQ(::rename(ann->at("Plans/new.txt").c_str(), away.c_str()), 0);
    ann->settle();
    ASSERT_EQ(::rename(away.c_str(), ann->at("Plans/new.txt").c_str()), 0);
    ann->settle();
  });
  followBoth();
  EXPECT_EQ(ann->names("Plans"), (Names{"Old", "a.txt", "new.txt"}));
  EXPECT_EQ(bob->names("Plans"), (Names{"Old", "a.txt", "new.txt"}));
  EXPECT_EQ(bob->readWhole("Plans/new.txt"), kLong);
}

TEST_F(ShareRemovalsTest, WhatIsPutBackComesAlsoToWhoHasMadeItHisOwn) {
  shareFolder(editor("bob"));
  ASSERT_EQ(bob->readWhole("Plans/a.txt"), kLong);
  ASSERT_EQ(setxattr(bob->at("Plans/a.txt").c_str(), kTagsAttribute, "blue", 4, 0), 0);
  const std::vector<std::uint64_t> ids{ann->id("Plans/a.txt"), ann->id("Plans/Old"),
                                       ann->id("Plans/Old/b.txt")};
  bob->rename("Plans/a.txt", "mine.txt");
  bob->rename("Plans/Old", "Mine");
  bob->settle();
  // As the trash, from where the owner puts it back.
  for (const char* name : {"a.txt", "Old"})
    ASSERT_EQ(::rename(ann->at("Plans/" + std::string(name)).c_str(),
                       (ann->layout.home() + "/" + name).c_str()),
              0);
  ann->settle();
  followBoth();
  for (const char* name : {"a.txt", "Old"})
    ASSERT_EQ(::rename((ann->layout.home() + "/" + name).c_str(),
                       ann->at("Plans/" + std::string(name)).c_str()),
              0);
  ann->settle();
  followBoth();
  bob->settle();
  EXPECT_EQ(bob->names("Plans"), (Names{"Old", "a.txt"}));
  EXPECT_EQ(bob->readWhole("Plans/a.txt"), kLong);
  EXPECT_EQ(bob->readWhole("Plans/Old/b.txt"), "short");
  EXPECT_EQ((std::vector{bob->id("Plans/a.txt"), bob->id("Plans/Old"), bob->id("Plans/Old/b.txt")}),
            ids);
  EXPECT_EQ(bob->names(), (Names{"Mine", "Plans", "mine.txt"}));
  EXPECT_EQ(bob->readWhole("mine.txt"), kLong);
  EXPECT_EQ(bob->readWhole("Mine/b.txt"), "short");
  EXPECT_EQ(readItemAttributes(bob->at("mine.txt").c_str()).extra.tags, Names{"blue"});
  for (const char* path : {"mine.txt", "Mine/b.txt"}) {
    EXPECT_EQ(zonesWith("bob", bob->id(path)), Names{QSUbiquitousDefaultContainerID}) << path;
    EXPECT_EQ(readItemAttributes(bob->at(path).c_str()).id, bob->id(path));
  }
  for (const std::uint64_t id : ids) EXPECT_EQ(zonesWith("bob", id), Names{}) << id;
  EXPECT_EQ(ann->names("Plans"), (Names{"Old", "a.txt"}));
}

TEST_F(ShareRemovalsTest, WhatIsPutBackWhileItIsSavedElsewhereIsRecordedOnceByEach) {
  shareFolder(editor("bob"));
  ASSERT_EQ(bob->readWhole("Plans/a.txt"), kLong);
  const std::uint64_t id = ann->id("Plans/a.txt");
  bob->rename("Plans/a.txt", "mine.txt");
  bob->settle();
  const std::string away = ann->layout.home() + "/away";
  ASSERT_EQ(::rename(ann->at("Plans/a.txt").c_str(), away.c_str()), 0);
  ann->settle();
  followBoth();
  ASSERT_EQ(::rename(away.c_str(), ann->at("Plans/a.txt").c_str()), 0);
  ann->settle();
  {
    const Pause saving = pauseAt("zarn.upload.read");
    bob->write("mine.txt", "Bob's own");
    EXPECT_EQ(bob->scanner->scanAll(), nullptr);
    ASSERT_TRUE(saving.waitUntilReached());
    EXPECT_EQ(bob->shares().refresh(std::string(NSFileProviderRootContainerItemIdentifier)),
              nullptr);
    EXPECT_NE(bob->id("mine.txt"), id);
    EXPECT_FALSE(bob->exists("Plans/a.txt"));
  }
  followBoth();
  EXPECT_EQ(bob->id("Plans/a.txt"), id);
  EXPECT_EQ(bob->readWhole("Plans/a.txt"), kLong);
  EXPECT_EQ(bob->read("mine.txt"), "Bob's own");
  EXPECT_EQ(zonesWith("bob", id), Names{});
  EXPECT_EQ(zonesWith("bob", bob->id("mine.txt")), Names{QSUbiquitousDefaultContainerID});
  EXPECT_EQ(zonesWith("ann", id), Names{share->recordID().zoneID().zoneName()});
}

TEST_F(ShareRemovalsTest, AFolderThatMovesHidesNothingThatIsRemovedElsewhere) {
  shareFolder(editor("bob"));
  ann->write("Plans/new.txt", kLong);
  ann->write("Plans/Old/new.txt", "stays");
  ann->settle();
  meanwhile("zarn.pull.placed", [&] {
    bob->remove("Plans/new.txt");
    bob->rename("Plans/Old", "Plans/Older");
  });
  const Names expected{"Older", "a.txt"};
  EXPECT_TRUE(waitUntil([&] {
    bob->settle();
    followBoth();
    return ann->names("Plans") == expected;
  }));
  EXPECT_EQ(bob->names("Plans"), expected);
  EXPECT_EQ(ann->names("Plans/Older"), (Names{"b.txt", "new.txt"}));
  EXPECT_EQ(bob->readWhole("Plans/Older/new.txt"), "stays");
}

}  // namespace
}  // namespace yomber
