#include <thread>

#include "platform/foundation/fault_points.h"
#include "zarn/scanner.h"
#include "zarn/test_drive.h"
#include "zarn/test_waiting.h"

namespace yomber {
namespace {

class LocationScanTest : public TestDrive {
 protected:
  LocationScanTest() {
    makeFolder("folder");
    write("folder/a.txt");
    scan();
  }
  std::optional<ItemRow> look(const std::string& path) {
    error = nullptr;
    return scanner->scanLocation(at(path), &error);
  }
  void expectNoSuchItem(const std::string& path) {
    EXPECT_FALSE(look(path));
    ASSERT_NE(error, nullptr);
    EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSFileNoSuchFileError)) << error->description();
  }
  NSErrorRef error;
};

TEST_F(LocationScanTest, AnswersTheRowAsItIsNow) {
  write("folder/a.txt", "longer text");
  setAttribute("folder/a.txt", kTagsAttribute, "blue");
  const auto found = look("folder/a.txt");
  ASSERT_TRUE(found);
  EXPECT_EQ(found->size, 11U);
  EXPECT_EQ(found->extra->tags, std::vector<std::string>{"blue"});
  EXPECT_EQ(look("")->id, kRootID);
}

TEST_F(LocationScanTest, AnUnchangedLocationCostsNoWrite) {
  const std::uint64_t rank = database->currentRank();
  ASSERT_TRUE(look("folder/a.txt"));
  EXPECT_EQ(database->currentRank(), rank);
}

TEST_F(LocationScanTest, FindsNewAncestorsWithAllTheyHold) {
  makeFolder("x");
  makeFolder("x/y");
  write("x/y/z");
  write("x/beside");
  const auto found = look("x/y/z");
  ASSERT_TRUE(found);
  EXPECT_EQ(found->parent, id("x/y"));
  EXPECT_NE(id("x/beside"), 0U);
}

TEST_F(LocationScanTest, ARenamedItemKeepsItsId) {
  const auto a = id("folder/a.txt");
  rename("folder/a.txt", "b.txt");
  EXPECT_EQ(look("b.txt")->id, a);
  EXPECT_FALSE(row("folder/a.txt"));
  const auto folder = id("folder");
  rename("folder", "renamed");
  EXPECT_EQ(look("renamed")->id, folder);
}

TEST_F(LocationScanTest, WhatIsGoneLosesItsRowAndComesBackUnderItsId) {
  const auto a = id("folder/a.txt");
  stampAll();
  rename("folder/a.txt", "b.txt");
  expectNoSuchItem("folder/a.txt");
  EXPECT_FALSE(store->itemByID(a));
  EXPECT_EQ(look("b.txt")->id, a);
}

/// What no scan but the first has seen carries no id yet; links never do.
class HalfSeenMoveTest : public TestDrive {
 protected:
  void vanish(const std::string& path) {
    NSErrorRef error;
    EXPECT_FALSE(scanner->scanLocation(at(path), &error)) << path;
    EXPECT_FALSE(row(path)) << path;
  }
};

TEST_F(HalfSeenMoveTest, KeepsTheIdsOfWhatCarriesNone) {
  makeFolder("folder");
  write("folder/below");
  write("file");
  ASSERT_EQ(symlink("nowhere", at("link").c_str()), 0);
  scan();
  ASSERT_FALSE(idOnDisk("file"));
  const auto folder = id("folder");
  const auto below = id("folder/below");
  const auto file = id("file");
  const auto link = id("link");
  for (const char* name : {"folder", "file", "link"}) {
    rename(name, std::string("moved ") + name);
    vanish(name);
  }
  EXPECT_EQ(scanFolders({""}), nullptr);
  EXPECT_EQ(id("moved folder"), folder);
  EXPECT_EQ(id("moved folder/below"), below);
  EXPECT_EQ(id("moved file"), file);
  EXPECT_EQ(id("moved link"), link);
}

TEST_F(HalfSeenMoveTest, GivesAnotherFileAnotherId) {
  write("a");
  scan();
  const auto a = id("a");
  remove("a");
  vanish("a");
  // Most likely with the inode that has just become free.
  for (int i = 0; i < 20; ++i) write("new" + std::to_string(i));
  EXPECT_EQ(scanFolders({""}), nullptr);
  for (int i = 0; i < 20; ++i) EXPECT_NE(id("new" + std::to_string(i)), a);
}

TEST_F(HalfSeenMoveTest, GivesAnIdToOneItemOnly) {
  write("a");
  scan();
  const auto a = id("a");
  rename("a", "b");
  vanish("a");
  ASSERT_EQ(link(at("b").c_str(), at("c").c_str()), 0);
  EXPECT_EQ(scanFolders({""}), nullptr);
  EXPECT_TRUE((id("b") == a) != (id("c") == a));
  EXPECT_NE(id("b"), id("c"));
}

TEST_F(LocationScanTest, ReplacedTypesAreOtherItems) {
  const auto a = id("folder/a.txt");
  remove("folder/a.txt");
  makeFolder("folder/a.txt");
  const auto found = look("folder/a.txt");
  ASSERT_TRUE(found);
  EXPECT_TRUE(found->isFolder());
  EXPECT_NE(found->id, a);
}

TEST_F(LocationScanTest, RefusesLocationsOutsideEveryPlace) {
  write("a.part");
  expectNoSuchItem("a.part");
  expectNoSuchItem("missing/below");
  expectNoSuchItem("folder/a.txt/below");
  expectNoSuchItem("folder/../folder");
  expectNoSuchItem(std::string(300, 'n'));
  for (const std::string& path : {layout.privateArea(), layout.promises() + "/5", layout.tree(),
                                  std::string("/etc/passwd"), std::string(), std::string("x")}) {
    EXPECT_FALSE(scanner->scanLocation(path, &error)) << path;
    EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSFileNoSuchFileError));
  }
}

TEST_F(LocationScanTest, SymbolicLinksOnTheWayAreNotFollowed) {
  ASSERT_EQ(symlink("folder", at("link").c_str()), 0);
  EXPECT_EQ(look("link")->kind, ItemKind::Bookmark);
  expectNoSuchItem("link/a.txt");
}

TEST_F(LocationScanTest, AScanThatLookedEarlierUndoesNothing) {
  const auto describe = [this] { return error ? error->description() : std::string("no error"); };
  std::jthread reconciling([this](const std::stop_token& stop) {
    while (!stop.stop_requested()) EXPECT_EQ(scanner->scanAll(), nullptr);
  });
  for (int i = 0; i < 300; ++i) {
    const std::string name = "file " + std::to_string(i);
    write(name);
    const auto found = look(name);
    ASSERT_TRUE(found) << name << ": " << describe();
    rename(name, "folder/" + name);
    const auto moved = look("folder/" + name);
    ASSERT_TRUE(moved) << name << ": " << describe();
    EXPECT_EQ(moved->id, found->id);
    EXPECT_TRUE(store->itemByID(found->id));
  }
  reconciling.request_stop();
  reconciling.join();
  scan();
  EXPECT_EQ(names(id("folder")).size(), 301U);
}

/// A scan of a folder that has seen what is there, and decides on it later.
class LaterDecisionTest : public LocationScanTest {
 protected:
  void beginScanning() {
    // Something new has to be read before that scan decides.
    makeFolder("folder/new");
    ASSERT_EQ(FaultPoint::arm("zarn.scan.before-new-folders=pause-until-file:" + gate_), nullptr);
    scanning_ = std::thread([this] { EXPECT_EQ(scanFolders({"folder"}), nullptr); });
    EXPECT_TRUE(waitUntil([&] { return std::filesystem::exists(gate_ + ".reached"); }));
  }
  void finishScanning() {
    std::ofstream(gate_).put('x');
    scanning_.join();
    FaultPoint::disarmAll();
  }

 private:
  const std::string gate_ = layout.home() + "/go";
  std::thread scanning_;
};

TEST_F(LaterDecisionTest, LeavesWhatHasComeBack) {
  const std::string away = layout.home() + "/away";
  const std::uint64_t item = id("folder/a.txt");
  ASSERT_EQ(::rename(at("folder/a.txt").c_str(), away.c_str()), 0);
  beginScanning();
  EXPECT_EQ(::rename(away.c_str(), at("folder/a.txt").c_str()), 0);
  const auto back = look("folder/a.txt");
  (void)sink->take();
  finishScanning();
  ASSERT_TRUE(back);
  EXPECT_EQ(back->id, item);
  EXPECT_EQ(id("folder/a.txt"), item);
  for (const ItemChange& change : sink->take()) EXPECT_NE(change.row.id, item) << "nothing to tell";
}

TEST_F(LaterDecisionTest, LeavesADocumentThatOthersHaveSeenSaved) {
  const std::uint64_t item = id("folder/a.txt");
  write("folder/saved", "saved");
  rename("folder/saved", "folder/a.txt");
  beginScanning();
  const auto saved = look("folder/a.txt");
  (void)sink->take();
  finishScanning();
  ASSERT_TRUE(saved);
  EXPECT_EQ(saved->id, item);
  EXPECT_EQ(id("folder/a.txt"), item);
  for (const ItemChange& change : sink->take()) EXPECT_NE(change.row.id, item) << "nothing to tell";
}

TEST_F(LaterDecisionTest, LeavesADocumentThatIsSavedOnceMore) {
  const std::uint64_t item = id("folder/a.txt");
  write("folder/saved", "saved");
  rename("folder/saved", "folder/a.txt");
  beginScanning();
  EXPECT_TRUE(look("folder/a.txt"));
  write("folder/saved", "saved again");
  rename("folder/saved", "folder/a.txt");
  finishScanning();
  const auto saved = look("folder/a.txt");
  ASSERT_TRUE(saved);
  EXPECT_EQ(saved->id, item);
}

}  // namespace
}  // namespace yomber
