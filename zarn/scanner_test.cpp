#include "zarn/scanner.h"

#include <sys/stat.h>
#include <sys/wait.h>

#include <map>
#include <set>

#include "platform/foundation/fault_points.h"
#include "platform/foundation/file_time.h"
#include "platform/ostrell/constants.h"
#include "zarn/folder_snapshot.h"
#include "zarn/row_queries.h"
#include "zarn/test_drive.h"
#include "zarn/write_transaction.h"

namespace yomber {
namespace {

class ScannerTest : public TestDrive {
 protected:
  void populate() {
    makeFolder("folder");
    makeFolder("folder/inner");
    write("folder/inner/deep.txt");
    write("folder/a.txt");
    write("top.txt");
  }
};

TEST_F(ScannerTest, DatesOfOtherCenturiesKeepTheirSignAndAreNoChange) {
  write("late");
  write("early");
  const timespec year2400[2] = {{13'569'465'600, 7}, {13'569'465'600, 7}};
  const timespec year1800[2] = {{-5'364'662'400, 7}, {-5'364'662'400, 7}};
  ASSERT_EQ(utimensat(AT_FDCWD, at("late").c_str(), year2400, 0), 0);
  // Some file systems begin later; what they make of it is what there is to keep.
  ASSERT_EQ(utimensat(AT_FDCWD, at("early").c_str(), year1800, 0), 0);
  scan();
  EXPECT_GT(row("late")->mtime, 9'000'000'000'000'000'000);
  EXPECT_LT(row("early")->mtime, -2'000'000'000'000'000'000);
  EXPECT_EQ(scan().changes, 0U);
}

TEST_F(ScannerTest, TheFirstScanFindsEverythingAndAskedAgainNothingNew) {
  populate();
  setAttribute("top.txt", kTagsAttribute, "red");
  EXPECT_TRUE(database->needsFirstScan());
  const ScanReport first = scan();
  EXPECT_FALSE(database->needsFirstScan());
  EXPECT_EQ(first.entries, 5U);
  EXPECT_EQ(names(), (std::vector<std::string>{"folder", "top.txt"}));
  EXPECT_EQ(row("folder/inner")->kind, ItemKind::Folder);
  EXPECT_EQ(row("top.txt")->size, 4U);
  EXPECT_EQ(row("top.txt")->extra->tags, std::vector<std::string>{"red"});
  EXPECT_EQ(store->counts().items, 5U);
  EXPECT_EQ(store->counts().folders, 2U);
  const std::uint64_t rank = database->currentRank();
  EXPECT_EQ(scan().changes, 0U);
  reopen();
  EXPECT_FALSE(database->needsFirstScan());
  EXPECT_EQ(scan().changes, 0U);
  EXPECT_EQ(database->currentRank(), rank);
}

TEST_F(ScannerTest, ReconcilesWhatChangedWhileNobodyLooked) {
  populate();
  scan();
  const std::uint64_t top = id("top.txt");
  const std::uint64_t gone = id("folder/a.txt");
  close();
  write("top.txt", "more text");
  remove("folder/a.txt");
  makeFolder("new");
  write("new/b.txt");
  open();
  scan();
  EXPECT_EQ(id("top.txt"), top);
  EXPECT_EQ(row("top.txt")->size, 9U);
  EXPECT_FALSE(store->itemByID(gone));
  EXPECT_NE(id("new/b.txt"), 0U);
  std::map<std::uint64_t, ItemChange> changes;
  for (const ItemChange& change : sink->take()) changes[change.row.id] = change;
  EXPECT_TRUE(changes[gone].isDead());
  EXPECT_TRUE(changes[id("new/b.txt")].isNew);
  EXPECT_FALSE(changes[top].isNew);
}

class ScannerMoves : public ScannerTest, public testing::WithParamInterface<bool> {
 protected:
  void settle() {
    scan();
    if (GetParam()) stampAll();
  }
};

TEST_P(ScannerMoves, MovesKeepIdsAcrossFolders) {
  populate();
  makeFolder("zz");
  settle();
  const std::map<std::string, std::uint64_t> before{{"folder", id("folder")},
                                                    {"inner", id("folder/inner")},
                                                    {"deep", id("folder/inner/deep.txt")},
                                                    {"a", id("folder/a.txt")},
                                                    {"top", id("top.txt")}};
  close();
  rename("folder/a.txt", "zz/renamed.txt");
  rename("folder/inner", "zz/inner");
  rename("folder", "aa");
  rename("top.txt", "aa/top.txt");
  open();
  scan();
  EXPECT_EQ(id("aa"), before.at("folder"));
  EXPECT_EQ(id("zz/inner"), before.at("inner"));
  EXPECT_EQ(id("zz/inner/deep.txt"), before.at("deep"));
  EXPECT_EQ(id("zz/renamed.txt"), before.at("a"));
  EXPECT_EQ(id("aa/top.txt"), before.at("top"));
  for (const ItemChange& change : sink->take()) EXPECT_FALSE(change.isDead() || change.isNew);
  EXPECT_EQ(scan().changes, 0U);
}

TEST_P(ScannerMoves, FoldersThatChangedPlacesWithEachOther) {
  makeFolder("a");
  makeFolder("a/b");
  write("a/b/x");
  settle();
  const auto a = id("a");
  const auto b = id("a/b");
  const auto x = id("a/b/x");
  rename("a/b", "b");
  rename("a", "b/a");
  scan();
  EXPECT_EQ(id("b"), b);
  EXPECT_EQ(id("b/a"), a);
  EXPECT_EQ(id("b/x"), x);
}

TEST_P(ScannerMoves, FilesThatSwappedNames) {
  write("one", "1");
  write("two", "22");
  settle();
  const auto one = id("one");
  const auto two = id("two");
  rename("one", "tmp");
  rename("two", "one");
  rename("tmp", "two");
  scan();
  EXPECT_EQ(id("one"), two);
  EXPECT_EQ(id("two"), one);
  EXPECT_EQ(row("one")->size, 2U);
  EXPECT_EQ(scan().changes, 0U);
}

TEST_P(ScannerMoves, AFileSavedOverADocumentTakesItsIdAndTheNextTakesItsOwnAlong) {
  write("a", "aaa");
  write("b", "bb");
  write("c", "c");
  settle();
  const auto a = id("a");
  const auto b = id("b");
  const auto c = id("c");
  rename("b", "c");  // saved over c
  rename("a", "b");  // moved to a free name
  scan();
  EXPECT_EQ(id("c"), c);
  EXPECT_EQ(row("c")->size, 2U);
  EXPECT_EQ(id("b"), a);
  EXPECT_FALSE(store->itemByID(b));
  EXPECT_FALSE(row("a"));
  EXPECT_EQ(scan().changes, 0U);
  EXPECT_EQ(idOnDisk("c"), c);
}

TEST_P(ScannerMoves, ACopyGetsAnIdOfItsOwn) {
  makeFolder("folder");
  write("folder/original", "text");
  settle();
  const auto original = id("folder/original");
  const auto folder = id("folder");
  // Also with the attribute that a copying program brings along; "copy" sorts before "folder".
  makeFolder("copy");
  setAttribute("copy", kIDAttribute, std::to_string(folder));
  write("copy/original", "text");
  setAttribute("copy/original", kIDAttribute, std::to_string(original));
  scan();
  EXPECT_EQ(id("folder"), folder);
  EXPECT_EQ(id("folder/original"), original);
  EXPECT_NE(id("copy"), folder);
  EXPECT_NE(id("copy/original"), original);
  EXPECT_EQ(idOnDisk("copy/original"), id("copy/original"));
  EXPECT_EQ(idOnDisk("copy"), id("copy"));
  EXPECT_EQ(scan().changes, 0U);
}

INSTANTIATE_TEST_SUITE_P(Stamped, ScannerMoves, testing::Bool());

TEST_F(ScannerTest, AFolderOnAReusedInodeIsAnother) {
  makeFolder("old");
  write("old/x");
  scan();
  stampAll();
  const auto oldRow = row("old");
  const auto oldFile = id("old/x");
  // The row is made to say what it would if the disk had used the number again at once.
  remove("old");
  makeFolder("old");
  struct stat status{};
  ASSERT_EQ(stat(at("old").c_str(), &status), 0);
  ASSERT_EQ(database->write([&](WriteTransaction& transaction) -> NSErrorRef {
    ItemRow reused = *oldRow;
    reused.inode = status.st_ino;
    transaction.updateQuietly(reused);
    return nullptr;
  }),
            nullptr);
  scan();
  EXPECT_NE(id("old"), oldRow->id);
  EXPECT_NE(id("old"), 0U);
  EXPECT_FALSE(store->itemByID(oldRow->id));
  EXPECT_FALSE(store->itemByID(oldFile));
  EXPECT_TRUE(names(id("old")).empty());
}

TEST_F(ScannerTest, ALostDatabaseIsBuiltAnewWithTheSameIds) {
  populate();
  ASSERT_EQ(symlink("top.txt", at("link").c_str()), 0);
  scan();
  stampAll();
  const auto folder = id("folder");
  const auto deep = id("folder/inner/deep.txt");
  const std::uint64_t rank = database->currentRank();
  close();
  std::ofstream(layout.databasePath(), std::ios::binary) << "no database at all, just some text";
  open();
  EXPECT_TRUE(database->needsFirstScan());
  scan();
  EXPECT_EQ(id("folder"), folder);
  EXPECT_EQ(id("folder/inner/deep.txt"), deep);
  EXPECT_GT(database->currentRank(), rank);
}

TEST_F(ScannerTest, AHomeCopiedToAnotherDiskKeepsItsIds) {
  populate();
  scan();
  stampAll();
  const auto deep = id("folder/inner/deep.txt");
  const auto folder = id("folder");
  close();
  // Every inode and every date of change is another.
  const std::string aside = layout.home() + "/moved";
  ASSERT_EQ(std::system(("cp -a '" + layout.tree() + "' '" + aside + "' && rm -r '" +
                         layout.tree() + "' && mv '" + aside + "' '" + layout.tree() + "'")
                            .c_str()),
            0);
  open();
  scan();
  EXPECT_EQ(id("folder"), folder);
  EXPECT_EQ(id("folder/inner/deep.txt"), deep);
  EXPECT_EQ(store->counts().items, 5U);
}

TEST_F(ScannerTest, StampsAreInvisible) {
  populate();
  scan();
  const std::uint64_t rank = database->currentRank();
  stampAll();
  EXPECT_EQ(idOnDisk("folder/a.txt"), id("folder/a.txt"));
  EXPECT_EQ(idOnDisk("folder"), id("folder"));
  EXPECT_EQ(scan().changes, 0U);
  EXPECT_EQ(database->currentRank(), rank);
  EXPECT_TRUE(sink->take().empty());
  std::uint32_t count = 1;
  EXPECT_EQ(scanner->stampSome(100, count), nullptr);
  EXPECT_EQ(count, 0U);
}

TEST_F(ScannerTest, AStampIsNoChangeThatIsStillToBeSeen) {
  constexpr int kFiles = 100;
  makeFolder("folder");
  for (int i = 0; i < kFiles; ++i) write("folder/" + std::to_string(i));
  scan();
  stampAll();
  for (int i = 0; i < kFiles; ++i) {
    const std::string path = "folder/" + std::to_string(i);
    struct stat status{};
    ASSERT_EQ(stat(at(path).c_str(), &status), 0);
    EXPECT_EQ(row(path)->ctime, nanosecondsOf(status.st_ctim)) << path;
  }
}

TEST_F(ScannerTest, AScanLeavesAFoldersDateOfAccess) {
  populate();
  // Older than its change: whoever reads it is noticed.
  const timespec dates[2] = {{.tv_sec = 1'000'000'000, .tv_nsec = 0},
                             {.tv_sec = 0, .tv_nsec = UTIME_NOW}};
  ASSERT_EQ(utimensat(AT_FDCWD, at("folder").c_str(), dates, 0), 0);
  scan();
  struct stat status{};
  ASSERT_EQ(stat(at("folder").c_str(), &status), 0);
  EXPECT_EQ(status.st_atim.tv_sec, 1'000'000'000);
}

TEST_F(ScannerTest, LinksAreKnownByPlace) {
  populate();
  ASSERT_EQ(link(at("top.txt").c_str(), at("folder/other-name").c_str()), 0);
  ASSERT_EQ(symlink("folder/a.txt", at("bookmark").c_str()), 0);
  ASSERT_EQ(symlink("/etc/hostname", at("outside").c_str()), 0);
  ASSERT_EQ(symlink("loop", at("loop").c_str()), 0);
  ASSERT_EQ(symlink("missing", at("dangling").c_str()), 0);
  ASSERT_EQ(symlink("../../../private", at("secret").c_str()), 0);
  ASSERT_EQ(mkfifo(at("fifo").c_str(), 0600), 0);
  scan();
  stampAll();
  EXPECT_NE(id("top.txt"), id("folder/other-name"));
  EXPECT_FALSE(idOnDisk("top.txt"));
  EXPECT_EQ(row("bookmark")->kind, ItemKind::Bookmark);
  for (const char* name : {"outside", "loop", "dangling", "secret"}) {
    EXPECT_EQ(row(name)->kind, ItemKind::Symlink) << name;
  }
  EXPECT_FALSE(row("fifo"));
  const auto bookmark = id("bookmark");
  const auto other = id("folder/other-name");
  const auto top = id("top.txt");
  // Made anew at the same place, a link is the same; a further name of a file is a new item.
  ASSERT_EQ(unlink(at("bookmark").c_str()), 0);
  ASSERT_EQ(symlink("top.txt", at("bookmark").c_str()), 0);
  ASSERT_EQ(link(at("top.txt").c_str(), at("third").c_str()), 0);
  scan();
  EXPECT_EQ(id("bookmark"), bookmark);
  EXPECT_EQ(id("top.txt"), top);
  EXPECT_EQ(id("folder/other-name"), other);
  EXPECT_NE(id("third"), 0U);
  const auto third = id("third");
  rename("third", "folder/moved");
  scan();
  EXPECT_EQ(id("folder/moved"), third);
  EXPECT_EQ(scan().changes, 0U);
}

TEST_F(ScannerTest, SymbolicLinksToFoldersAreNotFollowed) {
  populate();
  ASSERT_EQ(symlink(".", at("folder/up").c_str()), 0);
  ASSERT_EQ(symlink("/usr", at("usr").c_str()), 0);
  EXPECT_EQ(scan().entries, 7U);
}

TEST_F(ScannerTest, LeavesOutWhatNeverSyncs) {
  for (const char* name : {".~lock.a.odt#", "b.part", "c.nosync", ".#d", "~$e.doc"}) write(name);
  write("kept");
  scan();
  EXPECT_EQ(names(), std::vector<std::string>{"kept"});
  rename("kept", "kept.nosync");
  scan();
  EXPECT_TRUE(names().empty());
}

TEST_F(ScannerTest, ScansFoldersAsOneChange) {
  populate();
  scan();
  const auto a = id("folder/a.txt");
  (void)sink->take();
  rename("folder/a.txt", "folder/inner/b.txt");
  // The folder that it came to is compared first, then the one that it left, and the other way
  // round.
  ASSERT_EQ(scanFolders({"folder/inner", "folder"}), nullptr);
  EXPECT_EQ(id("folder/inner/b.txt"), a);
  rename("folder/inner/b.txt", "folder/a.txt");
  ASSERT_EQ(scanFolders({"folder/inner", "folder"}), nullptr);
  EXPECT_EQ(id("folder/a.txt"), a);
  for (const ItemChange& change : sink->take()) EXPECT_FALSE(change.isDead() || change.isNew);
}

TEST_F(ScannerTest, ANewFolderIsScannedWithAllThatItHolds) {
  scan();
  makeFolder("new");
  makeFolder("new/sub");
  write("new/sub/file");
  ASSERT_EQ(scanner->scanFolders({kRootID}), nullptr);
  EXPECT_NE(id("new/sub/file"), 0U);
  EXPECT_EQ(scan().changes, 0U);
}

TEST_F(ScannerTest, AFileMovedIntoANewFolderKeepsItsId) {
  populate();
  scan();
  const auto top = id("top.txt");
  makeFolder("new");
  rename("top.txt", "new/top.txt");
  ASSERT_EQ(scanner->scanFolders({kRootID}), nullptr);
  EXPECT_EQ(id("new/top.txt"), top);
}

TEST_F(ScannerTest, AFolderThatIsGoneIsFoundOutThroughItsParent) {
  populate();
  scan();
  const auto inner = id("folder/inner");
  const auto deep = id("folder/inner/deep.txt");
  remove("folder/inner");
  ASSERT_EQ(scanner->scanFolders({inner}), nullptr);
  EXPECT_FALSE(store->itemByID(inner));
  EXPECT_FALSE(store->itemByID(deep));
  EXPECT_TRUE(store->itemByID(id("folder")));
}

TEST_F(ScannerTest, ScansASubtree) {
  populate();
  scan();
  write("folder/inner/new");
  write("unrelated");
  ASSERT_EQ(scanner->scanSubtree(id("folder")), nullptr);
  EXPECT_NE(id("folder/inner/new"), 0U);
  EXPECT_EQ(id("unrelated"), 0U);
}

TEST_F(ScannerTest, TrashedItemsKeepTheirIdsAndAreMarked) {
  populate();
  scan();
  const auto folder = id("folder");
  const auto deep = id("folder/inner/deep.txt");
  ASSERT_EQ(::rename(at("folder").c_str(), (layout.trashFiles() + "/folder").c_str()), 0);
  ASSERT_EQ(scanner->scanFolders({kTrashID, kRootID}), nullptr);
  EXPECT_TRUE(store->itemByID(folder)->isTrashed());
  EXPECT_TRUE(store->itemByID(deep)->isTrashed());
  EXPECT_EQ(store->physicalPath(deep), layout.trashFiles() + "/folder/inner/deep.txt");
  ASSERT_EQ(::rename((layout.trashFiles() + "/folder").c_str(), at("back").c_str()), 0);
  scan();
  EXPECT_EQ(id("back"), folder);
  EXPECT_EQ(id("back/inner/deep.txt"), deep);
  EXPECT_FALSE(store->itemByID(deep)->isTrashed());
}

/// Does something when the trash, which comes after the root, is about to be read.
class MovingVisitor : public FolderVisitor {
 public:
  MovingVisitor(std::uint64_t trash, std::function<void()> work)
      : trash_(trash), work_(std::move(work)) {}
  void willReadFolder(std::uint64_t, int descriptor) override {
    FolderEntry folder;
    if (lookAtEntry(descriptor, "", folder) && folder.inode == trash_) work_();
  }
  void didIdentifyFolder(std::uint64_t, std::uint64_t) override {}
  void didNotReadFolder(std::uint64_t id) override { missed.push_back(id); }

  std::vector<std::uint64_t> missed;

 private:
  const std::uint64_t trash_;
  const std::function<void()> work_;
};

TEST_F(ScannerTest, AFolderThatComesIntoWhatWasReadBeforeIsToldOf) {
  std::filesystem::create_directories(layout.trashFiles() + "/folder/inner");
  scan();
  const auto folder = store->itemAtPath(layout.trashFiles() + "/folder");
  const auto trash = store->itemByID(kTrashID);
  ASSERT_TRUE(folder && trash);
  const auto visitor = std::make_shared<MovingVisitor>(trash->inode, [&] {
    ASSERT_EQ(::rename((layout.trashFiles() + "/folder").c_str(), at("back").c_str()), 0);
    // As whoever observes the root, and finds nothing new in what is known.
    EXPECT_TRUE(scanner->scanLocation(at("back")));
  });
  Scanner scanning(store, visitor);
  ASSERT_EQ(scanning.scanAll(), nullptr);
  EXPECT_EQ(id("back"), folder->id);
  EXPECT_EQ(visitor->missed, std::vector<std::uint64_t>{folder->id});
}

TEST_F(ScannerTest, LeavesAloneWhatItMayNotRead) {
  populate();
  makeFolder("listed");
  write("listed/b.txt");
  scan();
  const auto deep = id("folder/inner/deep.txt");
  const auto listed = id("listed/b.txt");
  close();
  // The superuser may read everything, so another user looks: one folder cannot be opened, of the
  // other only the names can be read.
  constexpr uid_t kNobody = 65534;
  const pid_t child = fork();
  if (child == 0) {
    const std::string home = std::filesystem::path(layout.home()).parent_path();
    const bool isRoot = geteuid() == 0;
    if (isRoot && std::system(("chown -R 65534:65534 '" + home + "'").c_str()) != 0) _exit(3);
    if (isRoot &&
        (setresgid(kNobody, kNobody, kNobody) != 0 || setresuid(kNobody, kNobody, kNobody) != 0)) {
      _exit(4);
    }
    if (chmod(at("folder/inner").c_str(), 0) != 0 || chmod(at("listed").c_str(), 0400) != 0)
      _exit(5);
    open();
    EXPECT_EQ(scan().unreadable, 1U);
    EXPECT_TRUE(store->itemByID(deep));
    EXPECT_TRUE(store->itemByID(listed));
    EXPECT_EQ(scanner->scanFolders({id("folder"), id("listed")}), nullptr);
    EXPECT_TRUE(store->itemByID(deep));
    EXPECT_TRUE(store->itemByID(listed));
    close();
    chmod(at("folder/inner").c_str(), 0700);
    _exit(HasFailure() ? 1 : 0);
  }
  int status = 0;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status;
}

TEST_F(ScannerTest, AKillDuringTheFirstScanStartsItAfresh) {
  populate();
  close();
  const pid_t child = fork();
  if (child == 0) {
    open();
    if (FaultPoint::arm("zarn.database.before-swap=abort")) _exit(3);
    (void)scanner->scanAll();
    _exit(4);
  }
  int status = 0;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  ASSERT_TRUE(WIFSIGNALED(status));
  EXPECT_TRUE(std::filesystem::exists(layout.databasePath() + ".new"));
  open();
  EXPECT_FALSE(std::filesystem::exists(layout.databasePath() + ".new"));
  EXPECT_TRUE(database->needsFirstScan());
  scan();
  EXPECT_NE(id("folder/inner/deep.txt"), 0U);
}

}  // namespace
}  // namespace yomber
