#include <fcntl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <csignal>
#include <functional>
#include <thread>

#include "zarn/content/test_sharing.h"
#include "zarn/test_closing.h"

namespace yomber {
namespace {

using Names = std::vector<std::string>;

/// What a process that dies at a fault point has begun is finished by the next one.
class SharesKillTest : public TwoDrives, public testing::WithParamInterface<const char*> {
 protected:
  /// Runs `work` with the drive of that account in a child that ends at the fault point. Threads
  /// are not carried across a fork: everything of ours is closed before.
  void dieDuring(const std::string& account, const std::string& point,
                 const std::function<void(SharingDrive&)>& work,
                 const std::function<void()>& beforeRestart = {}) {
    die(
        account,
        [&](SharingDrive& drive) {
          if (FaultPoint::arm(point + "=abort")) _exit(1);
          work(drive);
        },
        beforeRestart);
  }
  /// The same where the work sees to the end itself.
  void die(const std::string& account, const std::function<void(SharingDrive&)>& work,
           const std::function<void()>& beforeRestart = {}) {
    const std::string annsHome = ann->layout.home();
    const std::string bobsHome = bob->layout.home();
    for (auto* const drive : {&ann, &bob}) {
      (*drive)->engine->stop();
      waitUntilWritten(*(*drive)->database);
      drive->reset();
    }
    records.reset();
    for (const std::string& folder : {annsHome, bobsHome, storePath})
      ASSERT_FALSE(hasOpenFileIn(folder)) << folder;
    const pid_t child = fork();
    if (child == 0) {
      SharingDrive drive(account == "ann" ? annsHome : bobsHome,
                         std::make_shared<EmbeddedEngine>(storePath), account);
      work(drive);
      _exit(0);
    }
    int ending = 0;
    ASSERT_EQ(waitpid(child, &ending, 0), child);
    ASSERT_TRUE(WIFSIGNALED(ending)) << "it has not come to that";
    if (beforeRestart) beforeRestart();
    records = std::make_shared<EmbeddedEngine>(storePath);
    ann = std::make_unique<SharingDrive>(annsHome, records, "ann");
    bob = std::make_unique<SharingDrive>(bobsHome, records, "bob");
    for (int turn = 0; turn < 3; ++turn) {
      ASSERT_EQ(bob->follow(), nullptr);
      ASSERT_EQ(ann->follow(), nullptr);
    }
  }
  void expectSame() const {
    EXPECT_EQ(bob->names("Plans"), ann->names("Plans"));
    EXPECT_EQ(bob->readWhole("Plans/a.txt"), ann->readWhole("Plans/a.txt"));
    EXPECT_EQ(bob->id("Plans/a.txt"), ann->id("Plans/a.txt"));
  }
};

class ShareSaveKillTest : public SharesKillTest {};
class SharePullKillTest : public SharesKillTest {};
class ShareLeaveKillTest : public SharesKillTest {};
class ShareEndKillTest : public SharesKillTest {};

TEST_P(ShareSaveKillTest, TheShareIsOneAfterTheNextStart) {
  ann->makeFolder("Plans");
  ann->write("Plans/a.txt", kLong);
  ann->settle();
  dieDuring("ann", GetParam(), [](SharingDrive& drive) { drive.share("Plans", {editor("bob")}); });
  Shares::Copied copied;
  ASSERT_EQ(ann->shares().copyShare(ann->at("Plans"), copied), nullptr);
  ASSERT_EQ(bob->accept(copied.share), nullptr);
  EXPECT_EQ(bob->names("Plans"), Names{"a.txt"});
  EXPECT_EQ(bob->readWhole("Plans/a.txt"), kLong);
}

INSTANTIATE_TEST_SUITE_P(AtEachPoint, ShareSaveKillTest,
                         testing::Values("zarn.share.saved", "zarn.share.noted",
                                         "zarn.upload.committed", "zarn.spread.stored"));

TEST_P(SharePullKillTest, WhatIsAcceptedAppearsWithTheNextStart) {
  ann->makeFolder("Plans");
  ann->write("Plans/a.txt", kLong);
  ann->settle();
  share = ann->share("Plans", {editor("bob")});
  dieDuring("bob", GetParam(), [&](SharingDrive& drive) { (void)drive.accept(share); });
  expectSame();
  EXPECT_EQ(bob->names(), Names{"Plans"});
  EXPECT_EQ(bob->names("Plans"), Names{"a.txt"});
}

INSTANTIATE_TEST_SUITE_P(AtEachPoint, SharePullKillTest,
                         testing::Values("zarn.share.accepted", "zarn.pull.fetched",
                                         "zarn.pull.placed", "zarn.pull.stored"));

/// Bob's process ends when what came was removed before anybody looked at it.
class ShareUnseenKillTest : public SharesKillTest {
 protected:
  void removeUnseenAndDie(const std::function<void()>& beforeRestart = {}) {
    shareFolder(editor("bob"));
    addToFolder();
    removed = ann->id("Plans/new.txt");
    const std::string gate = storePath + "-placed";
    const auto work = [&](SharingDrive& drive) {
      const Pause placed("zarn.pull.placed", gate);
      std::thread following([&] { (void)drive.follow(); });
      if (!placed.waitUntilReached()) _exit(1);
      drive.remove("Plans/new.txt");
      drive.remove("Plans/Folder");
      if (FaultPoint::arm("zarn.pull.stored=abort")) _exit(1);
      placed.end();
      following.join();
    };
    die("bob", work, beforeRestart);
  }

  std::uint64_t removed = 0;
};

TEST_F(ShareUnseenKillTest, WhatWasRemovedBeforeItWasLookedAtIsRemovedForAll) {
  removeUnseenAndDie();
  const Names expected{"Old", "a.txt", "stays.txt"};
  EXPECT_TRUE(waitUntil([&] {
    EXPECT_EQ(bob->follow(), nullptr);
    EXPECT_EQ(ann->follow(), nullptr);
    return ann->names("Plans") == expected;
  }));
  EXPECT_EQ(bob->names("Plans"), expected);
  EXPECT_EQ(bob->readWhole("Plans/stays.txt"), "stays");
}

TEST_F(ShareUnseenKillTest, ItIsAlsoWhereAnotherAccountWasSignedInFirst) {
  const std::string home = bob->layout.home();
  removeUnseenAndDie([&] {
    records = std::make_shared<EmbeddedEngine>(storePath);
    const SharingDrive drive(home, records, "carol");
    EXPECT_EQ(drive.follow(), nullptr);
    EXPECT_FALSE(zonesWith("ann", removed).empty());
    drive.engine->setStore(std::make_shared<ContentStore>(records, "bob"), "bob");
    EXPECT_TRUE(
        waitUntil([&] { return drive.follow() == nullptr && zonesWith("ann", removed).empty(); }));
  });
}

class ShareConflictKillTest : public SharesKillTest {};

TEST_P(ShareConflictKillTest, WhatBothWroteIsThereAfterTheNextStart) {
  shareFolder(editor("bob"));
  ASSERT_EQ(bob->readWhole("Plans/a.txt"), kLong);
  ann->write("Plans/a.txt", "by ann");
  ann->settle();
  dieDuring("bob", GetParam(), [](SharingDrive& drive) {
    drive.write("Plans/a.txt", "by bob, longer");
    (void)drive.scanner->scanAll();
    for (int turn = 0; turn < 100; ++turn) (void)drive.follow();
  });
  expectSame();
  EXPECT_EQ(bob->readWhole("Plans/a.txt"), "by ann");
  bool isFound = false;
  for (const std::string& folder : {std::string(), std::string("Plans/")}) {
    for (const std::string& name : bob->names(folder))
      isFound = isFound || (!std::filesystem::is_directory(bob->at(folder + name)) &&
                            bob->readWhole(folder + name) == "by bob, longer");
  }
  EXPECT_TRUE(isFound) << "what Bob wrote is lost";
}

INSTANTIATE_TEST_SUITE_P(AtEachPoint, ShareConflictKillTest,
                         testing::Values("zarn.pull.displaced", "zarn.pull.placed",
                                         "zarn.pull.stored"));

class ShareUploadKillTest : public SharesKillTest {};

TEST_P(ShareUploadKillTest, WhatIsWrittenAfterASaveThatNobodyHeardOfIsTheDocument) {
  shareFolder(editor("bob"));
  ASSERT_EQ(bob->readWhole("Plans/a.txt"), kLong);
  const std::string name = GetParam();
  const std::string path = bob->at("Plans/" + name);
  dieDuring(
      "bob", "zarn.upload.committed",
      [&](SharingDrive& drive) {
        drive.write("Plans/" + name, "second");
        drive.settle();
      },
      [&] { std::ofstream(path, std::ios::binary) << "third, by bob"; });
  EXPECT_TRUE(waitUntil([&] {
    return bob->follow() == nullptr && ann->follow() == nullptr && ann->exists("Plans/" + name) &&
           ann->readWhole("Plans/" + name) == "third, by bob";
  }));
  EXPECT_EQ(bob->read("Plans/" + name), "third, by bob");
  EXPECT_EQ(ann->names("Plans"), bob->names("Plans"));
  for (const std::string& each : bob->names("Plans"))
    EXPECT_EQ(each.find("kept copy"), std::string::npos) << each;
}

INSTANTIATE_TEST_SUITE_P(OfOldAndNew, ShareUploadKillTest, testing::Values("a.txt", "new.txt"));

TEST_P(ShareLeaveKillTest, WhatIsSharedNoLongerGoesWithTheNextStart) {
  shareFolder(editor("bob"));
  ASSERT_EQ(bob->readWhole("Plans/a.txt"), kLong);
  ASSERT_EQ(ann->stopSharing("Plans"), nullptr);
  dieDuring("bob", GetParam(), [](SharingDrive& drive) {
    drive.write("Plans/new.txt", "unsaved");
    (void)drive.scanner->scanAll();
    (void)drive.follow();
  });
  EXPECT_EQ(bob->names(), Names{"new (kept copy).txt"});
  EXPECT_EQ(bob->readWhole("new (kept copy).txt"), "unsaved");
  EXPECT_EQ(ann->readWhole("Plans/a.txt"), kLong);
}

INSTANTIATE_TEST_SUITE_P(AtEachPoint, ShareLeaveKillTest,
                         testing::Values("zarn.leave.noted", "zarn.leave.kept",
                                         "zarn.leave.removing", "zarn.leave.gone"));

TEST_F(ShareLeaveKillTest, WhatWasPutIntoAnOpenFolderBeforeTheEndIsThereAfterTheNextStart) {
  shareFolder(editor("bob"));
  ASSERT_EQ(ann->stopSharing("Plans"), nullptr);
  const std::string gate = storePath + "-removing";
  die("bob", [&](SharingDrive& drive) {
    const FileDescriptor folder(
        open(drive.at("Plans/Old").c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    const Pause removing("zarn.leave.removing", gate);
    std::thread following([&] { (void)drive.follow(); });
    if (!removing.waitUntilReached()) _exit(1);
    const FileDescriptor file(
        openat(folder.get(), "late.txt", O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600));
    if (pwrite(file.get(), "late", 4, 0) != 4) _exit(1);
    (void)raise(SIGKILL);
  });
  bool isFound = false;
  for (const std::string& name : bob->names()) {
    const bool isFolder = std::filesystem::is_directory(bob->at(name));
    for (const std::string& each : isFolder ? bob->names(name) : Names{""})
      isFound = isFound || bob->read(isFolder ? name + "/" + each : name) == "late";
  }
  EXPECT_TRUE(isFound) << "what Bob wrote is lost";
  EXPECT_FALSE(bob->exists("Plans"));
}

TEST_P(ShareEndKillTest, TheOwnersRecordsComeBackWithTheNextStart) {
  shareFolder(viewer("bob"));
  dieDuring("ann", GetParam(), [](SharingDrive& drive) { (void)drive.stopSharing("Plans"); });
  Shares::Copied copied;
  EXPECT_TRUE(ann->shares()
                  .copyShare(ann->at("Plans"), copied)
                  ->is(QSOstrellErrorDomain, QSOstrellErrorNotShared));
  std::vector<RZRecordZone> zones;
  ASSERT_EQ(records->fetchZones({QSUbiquitousRozzelContainerIdentifier, "ann"}, zones), nullptr);
  EXPECT_EQ(zones.size(), 1U) << "the share's zone is gone";
  EXPECT_EQ(bob->names(), Names{});
  EXPECT_EQ(ann->names("Plans"), (Names{"Old", "a.txt"}));
}

INSTANTIATE_TEST_SUITE_P(AtEachPoint, ShareEndKillTest,
                         testing::Values("zarn.share.destroyed", "zarn.leave.noted",
                                         "zarn.upload.committed"));

}  // namespace
}  // namespace yomber
