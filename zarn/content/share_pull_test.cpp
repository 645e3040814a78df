#include "zarn/content/share_pull.h"

#include <fcntl.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <array>
#include <cstring>
#include <filesystem>
#include <thread>

#include "zarn/content/test_sharing.h"
#include "zarn/item_attributes.h"

namespace yomber {
namespace {

using Names = std::vector<std::string>;

using SharePullTest = TwoDrives;

TEST_F(SharePullTest, ANameThatLeadsElsewhereIsRefused) {
  ann->makeFolder("Folder");
  ann->write("mine.txt", "mine");
  const ContentCore core(ann->store, ann->scanner, ContentEngine::Options());
  const ContentStore documents(records, "ann");
  const SharedTree tree(core, documents);
  for (const std::string& name : {std::string("../out.txt"), std::string(".."), std::string("."),
                                  std::string(), std::string("a\0b", 3), std::string(256, 'x')}) {
    std::string wanted = name;
    EXPECT_NE(tree.place(ann->at("mine.txt"), ann->at("Folder"), wanted), nullptr) << name;
  }
  EXPECT_EQ(ann->names(), (Names{"Folder", "mine.txt"}));
  EXPECT_EQ(ann->names("Folder"), Names{});
}

TEST_F(SharePullTest, WhatIsSavedWhileAChangeIsTakenOverIsUploaded) {
  const std::string saved = "by bob";
  shareFolder(editor("bob"));
  ASSERT_EQ(bob->readWhole("Plans/a.txt"), kLong);
  ann->write("Plans/a.txt", "by ann");
  ann->settle();
  // A change waits for the next time while his own drive has the document open.
  bool isPlaced = false;
  for (int turns = 0; !isPlaced && turns < 100; ++turns) {
    // Or else his drive would be done with it before the page is.
    ASSERT_EQ(FaultPoint::arm("zarn.upload.read=error"), nullptr);
    meanwhile("zarn.pull.placed", [&] {
      isPlaced = std::filesystem::file_size(bob->at("Plans/a.txt")) == saved.size();
      if (!isPlaced) return;
      bob->write("saving", saved);  // as long as Ann's: a stamp alone tells the two apart
      // As an editor that takes attributes along.
      const std::string id = std::to_string(bob->id("Plans/a.txt"));
      ASSERT_EQ(setxattr(bob->at("saving").c_str(), kIDAttribute, id.data(), id.size(), 0), 0);
      bob->rename("saving", "Plans/a.txt");
      // As a scan at the same time: nothing is left to be written to the file.
      EXPECT_NE(bob->scanner->scanLocation(bob->at("Plans/a.txt")), std::nullopt);
    });
  }
  ASSERT_TRUE(isPlaced);
  bob->settle();
  EXPECT_TRUE(waitUntil(
      [&] { return ann->follow() == nullptr && ann->readWhole("Plans/a.txt") == saved; }));
  followBoth();
  EXPECT_EQ(bob->readWhole("Plans/a.txt"), saved);
}

/// What a program would have written that is called for an access list.
std::string accessListWithOneUser() {
  struct Entry {
    std::uint16_t tag;
    std::uint16_t permission;
    std::uint32_t id;
  };
  constexpr std::uint32_t kVersion = 2;
  constexpr std::uint32_t kNobody = ~0U;
  constexpr std::array kEntries{
      Entry{.tag = 0x01, .permission = 7, .id = kNobody},  // owner
      Entry{.tag = 0x02, .permission = 4, .id = 4242},     // a user
      Entry{.tag = 0x04, .permission = 5, .id = kNobody},  // group
      Entry{.tag = 0x10, .permission = 5, .id = kNobody},  // the most that is given
      Entry{.tag = 0x20, .permission = 5, .id = kNobody},  // others
  };
  std::string list(sizeof(kVersion) + sizeof(kEntries), '\0');
  std::memcpy(list.data(), &kVersion, sizeof(kVersion));
  std::memcpy(list.data() + sizeof(kVersion), kEntries.data(), sizeof(kEntries));
  return list;
}

std::string attributeAt(const std::string& path, const char* name) {
  std::array<char, 256> value{};
  const ssize_t length = getxattr(path.c_str(), name, value.data(), value.size());
  return length < 0 ? "none" : std::string(value.data(), static_cast<std::size_t>(length));
}

mode_t modeAt(const std::string& path) {
  struct stat status{};
  EXPECT_EQ(lstat(path.c_str(), &status), 0) << path;
  return status.st_mode & 07777U;
}

TEST_F(SharePullTest, WhatAnotherChangesKeepsItsPermissionsAndAttributes) {
  shareFolder(editor("bob"));
  ASSERT_EQ(bob->readWhole("Plans/a.txt"), kLong);
  const std::string path = ann->at("Plans/a.txt");
  const std::string list = accessListWithOneUser();
  ASSERT_EQ(setxattr(path.c_str(), "user.test", "value", 5, 0), 0);
  ASSERT_EQ(setxattr(path.c_str(), "system.posix_acl_access", list.data(), list.size(), 0), 0);
  ASSERT_EQ(chmod(path.c_str(), 04755), 0);
  ann->settle();
  bob->write("Plans/a.txt", "by bob");
  bob->settle();
  ASSERT_EQ(ann->follow(), nullptr);
  EXPECT_EQ(ann->readWhole("Plans/a.txt"), "by bob");
  EXPECT_EQ(modeAt(path), 0755U) << "it runs as whoever starts it";
  EXPECT_EQ(attributeAt(path, "user.test"), "value");
  EXPECT_EQ(attributeAt(path, "system.posix_acl_access"), list);
}

TEST_F(SharePullTest, AViewersDocumentThatChangesKeepsThemAndMayNotBeWrittenTo) {
  shareFolder(viewer("bob"));
  const std::string path = bob->at("Plans/a.txt");
  ASSERT_EQ(setxattr(path.c_str(), "user.test", "value", 5, 0), 0);
  ASSERT_EQ(chmod(path.c_str(), 0666), 0);
  bob->settle();
  ann->write("Plans/a.txt", "by ann");
  ann->settle();
  ASSERT_EQ(bob->follow(), nullptr);
  EXPECT_EQ(bob->readWhole("Plans/a.txt"), "by ann");
  EXPECT_EQ(modeAt(path), 0444U);
  EXPECT_EQ(attributeAt(path, "user.test"), "value");
  EXPECT_EQ(attributeAt(path, kOnlyReadableAttribute), "1");
}

TEST_F(SharePullTest, WhatIsAddedToAFolderThatAnotherDeletesStays) {
  shareFolder(editor("bob"));
  bob->write("Plans/Old/new.txt", "new");
  bob->makeFolder("Plans/Old/Sub");
  bob->write("Plans/Old/Sub/deep.txt", "deep");
  bob->settle();
  bob->write("Plans/Old/mine.nosync", "never scanned");
  ann->remove("Plans/Old");
  ann->settle();
  followBoth();
  EXPECT_EQ(bob->names("Plans"), (Names{"Sub", "a.txt", "mine.nosync", "new.txt"}));
  EXPECT_EQ(ann->names("Plans"), (Names{"Sub", "a.txt", "new.txt"}));
  for (const auto* drive : {ann.get(), bob.get()}) {
    EXPECT_EQ(drive->readWhole("Plans/new.txt"), "new");
    EXPECT_EQ(drive->readWhole("Plans/Sub/deep.txt"), "deep");
  }
}

TEST_F(SharePullTest, AFolderThatAnotherDeletesGoesWithAllThatWasInIt) {
  shareFolder(editor("bob"));
  ann->makeFolder("Plans/Old/Sub");
  ann->write("Plans/Old/Sub/c.txt", "c");
  ann->settle();
  followBoth();
  ASSERT_EQ(bob->names("Plans/Old"), (Names{"Sub", "b.txt"}));
  ann->remove("Plans/Old");
  ann->settle();
  followBoth();
  EXPECT_EQ(bob->names("Plans"), Names{"a.txt"});
  EXPECT_EQ(ann->names("Plans"), Names{"a.txt"});
}

TEST_F(SharePullTest, WhatAnotherHasChangedIsNotDeleted) {
  shareFolder(editor("bob"));
  ann->write("Plans/a.txt", "second");
  ann->settle();
  bob->remove("Plans/a.txt");
  ASSERT_EQ(bob->scanner->scanAll(), nullptr);
  ASSERT_TRUE(bob->engine->waitUntilIdle(SharingDrive::kPatience));
  EXPECT_TRUE(waitUntil([&] { return bob->follow() == nullptr && bob->exists("Plans/a.txt"); }));
  followBoth();
  EXPECT_EQ(bob->readWhole("Plans/a.txt"), "second");
  EXPECT_EQ(ann->readWhole("Plans/a.txt"), "second");
}

TEST_F(SharePullTest, WhatIsMovedOutTakesAlongWhatAnotherHasChanged) {
  shareFolder(editor("bob"));
  ann->write("Plans/a.txt", "second");
  ann->settle();
  bob->rename("Plans/a.txt", "mine.txt");
  ASSERT_EQ(bob->scanner->scanAll(), nullptr);
  ASSERT_TRUE(bob->engine->waitUntilIdle(SharingDrive::kPatience));
  EXPECT_TRUE(waitUntil(
      [&] { return bob->follow() == nullptr && bob->readWhole("mine.txt") == "second"; }));
  EXPECT_TRUE(waitUntil([&] { return ann->follow() == nullptr && !ann->exists("Plans/a.txt"); }));
  followBoth();
  EXPECT_EQ(bob->names("Plans"), Names{"Old"});
  EXPECT_EQ(bob->readWhole("mine.txt"), "second");
}

TEST_F(SharePullTest, WhatIsOpenIsNotRemoved) {
  shareFolder(editor("bob"));
  ASSERT_EQ(bob->readWhole("Plans/a.txt"), kLong);
  ann->remove("Plans/a.txt");
  ann->settle();
  {
    const FileDescriptor file(open(bob->at("Plans/a.txt").c_str(), O_WRONLY | O_CLOEXEC));
    ASSERT_TRUE(file);
    ASSERT_EQ(bob->follow(), nullptr);
    EXPECT_TRUE(bob->exists("Plans/a.txt")) << "it waits";
    ASSERT_EQ(pwrite(file.get(), "edited", 6, 0), 6);
  }
  ASSERT_EQ(bob->scanner->scanAll(), nullptr);
  EXPECT_TRUE(waitUntil(
      [&] { return bob->follow() == nullptr && bob->exists("Plans/a (kept copy).txt"); }));
  followBoth();
  EXPECT_EQ(ann->names("Plans"), (Names{"Old", "a (kept copy).txt"}));
  EXPECT_EQ(ann->readWhole("Plans/a (kept copy).txt"), "edited" + kLong.substr(6));
}

TEST_F(SharePullTest, ALinkIsKeptWhenSharingStops) {
  shareFolder(editor("bob"));
  std::filesystem::create_symlink("a.txt", bob->at("Plans/link"));
  bob->settle();
  ASSERT_EQ(ann->stopSharing("Plans"), nullptr);
  ASSERT_EQ(bob->follow(), nullptr);
  EXPECT_EQ(bob->names(), Names{"link"});
}

TEST_F(SharePullTest, WhatAViewerMovesOutComesBack) {
  shareFolder(viewer("bob"));
  ASSERT_EQ(chmod(bob->at("Plans").c_str(), 0700), 0);
  bob->rename("Plans/a.txt", "taken.txt");
  ASSERT_EQ(bob->scanner->scanAll(), nullptr);
  EXPECT_TRUE(waitUntil([&] { return bob->follow() == nullptr && bob->exists("Plans/a.txt"); }));
  ASSERT_EQ(bob->follow(), nullptr);
  EXPECT_EQ(bob->names(), Names{"Plans"});
  EXPECT_EQ(bob->readWhole("Plans/a.txt"), kLong);
  EXPECT_EQ(bob->id("Plans/a.txt"), ann->id("Plans/a.txt"));
}

TEST_F(SharePullTest, OneThatIsCutShortByTheEndGoesOnWithTheNextProcess) {
  shareFolder(editor("bob"));
  constexpr std::uint64_t kFolders = 1'200;  // more than a page
  constexpr std::uint64_t kFirst = 4'000'000'000;
  const RZRecordZoneID zone = share->recordID().zoneID();
  const auto parent = static_cast<std::int64_t>(ann->id("Plans"));
  for (std::uint64_t done = 0; done < kFolders;) {
    RZRecordBatch batch;
    for (int i = 0; i < 200; ++i, ++done) {
      auto record = std::make_shared<RZRecord>(kQSRecordTypeFolder,
                                               RZRecordID(std::to_string(kFirst + done), zone));
      record->setObject("f" + std::to_string(done), kQSRecordKeyName);
      record->setObject(parent, kQSRecordKeyParent);
      batch.recordsToSave.push_back(std::move(record));
    }
    std::vector<RZRecordRef> saved;
    ASSERT_EQ(records->modifyRecords({QSUbiquitousRozzelContainerIdentifier, "ann"}, batch, saved),
              nullptr);
  }
  const std::string gate = storePath + "-go";
  ASSERT_EQ(FaultPoint::arm("zarn.pull.placed=pause-until-file:" + gate), nullptr);
  NSErrorRef error;
  std::thread following([&] {
    error = bob->shares().refresh(std::string(NSFileProviderRootContainerItemIdentifier));
  });
  EXPECT_TRUE(waitUntil([&] { return std::filesystem::exists(gate + ".reached"); }));
  goOffline();  // or else its content would come before the end, and be there from then on
  std::thread ending([&] { bob->engine->stop(); });
  EXPECT_TRUE(waitUntil([&] {
    const NSErrorRef refused = bob->provide("Plans/a.txt");
    return refused && refused->is(NSCocoaErrorDomain, NSUserCancelledError);
  })) << "it is about to end";
  std::ofstream(gate).put('x');
  following.join();
  ending.join();
  FaultPoint::disarmAll();
  comeBack();
  ASSERT_NE(error, nullptr) << "what is missing must not count as known";
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSUserCancelledError)) << error->description();
  EXPECT_LT(bob->names("Plans").size(), kFolders);
  bob->restart();
  ASSERT_EQ(bob->follow(), nullptr);
  EXPECT_EQ(bob->names("Plans").size(), kFolders + 2);
}

TEST_F(SharePullTest, NothingIsFollowedBeforeTheTreeWasScanned) {
  shareFolder(editor("bob"));
  bob->engine->stop();
  bob->engine.reset();
  bob->scanner.reset();
  bob->store.reset();
  bob->database.reset();
  ann->write("Plans/new.txt", "new");
  ann->settle();
  bob->open();
  bob->start();
  ASSERT_EQ(bob->follow(), nullptr);
  EXPECT_FALSE(bob->exists("Plans/new.txt")) << "what was moved meanwhile is not known yet";
  ASSERT_EQ(bob->scanner->scanAll(), nullptr);
  ASSERT_EQ(bob->follow(), nullptr);
  EXPECT_EQ(bob->readWhole("Plans/new.txt"), "new");
}

/// Has something done while an upload of Bob's is in the store, but not yet confirmed here.
class ShareConfirmingTest : public TwoDrives {
 protected:
  void beforeConfirming(const std::function<void()>& work) const {
    const std::string gate = storePath + "-confirm";
    ASSERT_EQ(FaultPoint::arm("zarn.upload.committed=pause-until-file:" + gate), nullptr);
    ASSERT_EQ(bob->scanner->scanAll(), nullptr);
    const bool isReached = waitUntil([&] { return std::filesystem::exists(gate + ".reached"); });
    FaultPoint::disarmAll();  // who waits already goes on waiting
    if (isReached) work();
    std::ofstream(gate).put('x');
    ASSERT_TRUE(isReached);
  }
};

TEST_F(ShareConfirmingTest, AFolderThatComesBackWhileItIsRemovedHasItsRecordAgain) {
  shareFolder(editor("bob"));
  bob->makeFolder("Plans/Empty");
  bob->settle();
  ASSERT_EQ(ann->follow(), nullptr);
  const std::uint64_t id = bob->id("Plans/Empty");
  const std::string away = bob->layout.home() + "/away";
  ASSERT_EQ(::rename(bob->at("Plans/Empty").c_str(), away.c_str()), 0);
  beforeConfirming([&] {
    ASSERT_EQ(::rename(away.c_str(), bob->at("Plans/Empty").c_str()), 0);
    ASSERT_EQ(bob->scanner->scanAll(), nullptr);
  });
  EXPECT_TRUE(waitUntil([&] { return !zonesWith("ann", id).empty(); }));
  followBoth();
  EXPECT_TRUE(ann->exists("Plans/Empty"));
  EXPECT_TRUE(bob->exists("Plans/Empty"));
}

TEST_F(ShareConfirmingTest, ANameThatAnotherGivesMeanwhileIsTheSameForBothInTheEnd) {
  shareFolder(editor("bob"));
  bob->rename("Plans/a.txt", "Plans/bobs.txt");
  beforeConfirming([&] {
    ASSERT_EQ(ann->follow(), nullptr);
    ann->rename("Plans/bobs.txt", "Plans/anns.txt");
    ann->settle();
    EXPECT_EQ(bob->shares().refresh(std::string(NSFileProviderRootContainerItemIdentifier)),
              nullptr);
  });
  EXPECT_TRUE(waitUntil([&] {
    followBoth();
    return bob->names("Plans") == ann->names("Plans");
  }));
}

}  // namespace
}  // namespace yomber
