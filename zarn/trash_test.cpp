#include "zarn/trash.h"

#include <gmock/gmock.h>

#include <ctime>
#include <thread>

#include "platform/foundation/fault_attributes.h"
#include "platform/foundation/fault_points.h"
#include "platform/ostrell/constants.h"
#include "zarn/test_drive.h"

namespace yomber {
namespace {

namespace fs = std::filesystem;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;
using testing::UnorderedElementsAre;

class TrashTest : public TestDrive {
 protected:
  TrashTest() {
    trash = Trash::create(store, std::shared_ptr<Scanner>(scanner.get(), [](Scanner*) {}));
    database->addSink(trash);
    scan();
  }
  ~TrashTest() override { FaultPoint::disarmAll(); }

  static bool never() { return false; }
  /// Where it is in the trash; empty when it was refused.
  std::string throwAway(const std::string& path, NSErrorRef* error = nullptr) {
    return trash->trash(path, never, error).value_or("");
  }
  [[nodiscard]] std::string inTrash(const std::string& name) const {
    return layout.trashFiles() + "/" + name;
  }
  [[nodiscard]] std::string infoOf(const std::string& name) const {
    return layout.trashInfo() + "/" + name + ".trashinfo";
  }
  [[nodiscard]] std::string putBack(const std::string& path, NSErrorRef* error = nullptr) const {
    return trash->putBackLocation(path, error).value_or("");
  }
  static std::vector<std::string> namesIn(const std::string& folder) {
    std::vector<std::string> names;
    for (const auto& entry : fs::directory_iterator(folder)) {
      names.push_back(entry.path().filename());
    }
    std::sort(names.begin(), names.end());
    return names;
  }
  static std::string contentOf(const std::string& path) {
    std::ifstream file(path, std::ios::binary);
    return {std::istreambuf_iterator<char>(file), {}};
  }
  /// Information goes on a queue: waits for its turn.
  static bool comesTrue(const std::function<bool()>& condition) {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(20);
    while (!condition()) {
      if (std::chrono::steady_clock::now() > deadline) return false;
      std::this_thread::yield();
    }
    return true;
  }
  void makeContainer(const std::string& id, const std::string& name) {
    ASSERT_EQ(store->setContainers({{id, name}}), nullptr);
  }
  static void expectRefused(const NSErrorRef& error, int number) {
    ASSERT_NE(error, nullptr);
    EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSFileWriteUnknownError)) << error->description();
    ASSERT_NE(error->underlyingError(), nullptr);
    EXPECT_TRUE(error->underlyingError()->is(NSPOSIXErrorDomain, number)) << error->description();
    EXPECT_TRUE(error->userInfo().contains(NSLocalizedDescriptionKey));
  }

  std::shared_ptr<Trash> trash;
};

TEST_F(TrashTest, MovesAnItemAndKeepsWhatItIs) {
  makeFolder("Reports");
  write("Reports/plan.txt", "the plan");
  scan();
  const std::uint64_t id = this->id("Reports/plan.txt");
  (void)sink->take();

  EXPECT_EQ(throwAway(at("Reports/plan.txt")), inTrash("plan.txt"));

  EXPECT_FALSE(fs::exists(at("Reports/plan.txt")));
  EXPECT_EQ(contentOf(inTrash("plan.txt")), "the plan");
  const auto row = store->itemByID(id);
  ASSERT_TRUE(row.has_value());
  EXPECT_EQ(row->parent, kTrashID);
  EXPECT_TRUE(row->isTrashed());
  EXPECT_FALSE(store->itemAtPath(at("Reports/plan.txt")).has_value());
  for (const auto& change : sink->take()) EXPECT_FALSE(change.isDead());
}

TEST_F(TrashTest, WritesDownWhereItemsCameFrom) {
  makeFolder("Two words");
  write("Two words/50%.txt");
  scan();
  const std::time_t before = std::time(nullptr);
  throwAway(at("Two words/50%.txt"));
  const std::string info = contentOf(infoOf("50%.txt"));
  EXPECT_THAT(info, HasSubstr("[Trash Info]\nPath=Two%20words/50%25.txt\nDeletionDate="));
  const auto parsed = parseTrashInfo(info);
  ASSERT_TRUE(parsed.has_value());
  EXPECT_EQ(parsed->containerID, QSUbiquitousDefaultContainerID);
  EXPECT_EQ(parsed->kind, "document");
  const auto earliest = NSDate::fromNanoseconds(before * 1'000'000'000LL);
  EXPECT_GE(parsed->deletionDate, trashDeletionDate(earliest));
  EXPECT_LE(parsed->deletionDate, trashDeletionDate(NSDate::now()));
  EXPECT_EQ(putBack(inTrash("50%.txt")), at("Two words/50%.txt"));
}

TEST_F(TrashTest, TakesAFolderWithAllThatItHolds) {
  makeFolder("a");
  makeFolder("a/b");
  write("a/b/c.txt");
  scan();
  const std::uint64_t id = this->id("a/b/c.txt");
  EXPECT_EQ(throwAway(at("a")), inTrash("a"));
  EXPECT_TRUE(store->itemByID(id)->isTrashed());
  EXPECT_EQ(store->logicalPath(id), inTrash("a/b/c.txt"));
  EXPECT_EQ(putBack(inTrash("a/b/c.txt")), at("a/b/c.txt"));
  EXPECT_THAT(namesIn(layout.trashInfo()), ElementsAre("a.trashinfo"));
}

TEST_F(TrashTest, TakesAnItemThatNoScanHasSeenYet) {
  write("new.txt");
  EXPECT_EQ(throwAway(at("new.txt")), inTrash("new.txt"));
}

TEST_F(TrashTest, GivesTakenNamesANumber) {
  makeFolder("a");
  makeFolder("b");
  for (const char* path : {"x.txt", "a/x.txt", "b/x.txt"}) write(path, path);
  scan();
  EXPECT_EQ(throwAway(at("x.txt")), inTrash("x.txt"));
  EXPECT_EQ(throwAway(at("a/x.txt")), inTrash("x 2.txt"));
  EXPECT_EQ(throwAway(at("b/x.txt")), inTrash("x 3.txt"));
  EXPECT_EQ(contentOf(inTrash("x 2.txt")), "a/x.txt");
  EXPECT_EQ(putBack(inTrash("x 3.txt")), at("b/x.txt"));
}

TEST_F(TrashTest, LeavesNamesAloneThatOtherProgramsHaveReserved) {
  std::ofstream(infoOf("x.txt")) << "[Trash Info]\nPath=elsewhere/x.txt\n";
  write("x.txt");
  EXPECT_EQ(throwAway(at("x.txt")), inTrash("x 2.txt"));
  EXPECT_EQ(contentOf(infoOf("x.txt")), "[Trash Info]\nPath=elsewhere/x.txt\n");
}

TEST_F(TrashTest, ShortensNamesThatLeaveNoRoomForTheInformation) {
  const std::string name = std::string(251, 'n') + ".txt";
  write(name);
  const std::string location = throwAway(at(name));
  EXPECT_EQ(location, inTrash(std::string(241, 'n') + ".txt"));
  EXPECT_EQ(putBack(location), at(name));
}

TEST_F(TrashTest, TakesFaultsAndLinksAsTheyAre) {
  write("fault.txt", "beginning");
  setAttribute("fault.txt", kFaultAttribute, "x");
  write("target.txt");
  fs::create_symlink("target.txt", at("link"));
  fs::create_hard_link(at("target.txt"), at("second"));
  scan();
  const std::uint64_t link = id("link");
  const std::uint64_t second = id("second");
  EXPECT_EQ(throwAway(at("fault.txt")), inTrash("fault.txt"));
  EXPECT_TRUE(isFaultAtPath(inTrash("fault.txt")));
  EXPECT_EQ(throwAway(at("link")), inTrash("link"));
  EXPECT_EQ(store->itemByID(link)->parent, kTrashID);
  EXPECT_EQ(throwAway(at("second")), inTrash("second"));
  EXPECT_EQ(store->itemByID(second)->parent, kTrashID);
  EXPECT_TRUE(fs::exists(at("target.txt")));
}

TEST_F(TrashTest, TakesAnItemByEitherOfItsNames) {
  // One text in two normal forms: the later one has another name in the drive.
  write("e\xcc\x81");
  write("\xc3\xa9", "second");
  scan();
  std::string logical;
  for (const auto& row : store->children(kRootID)) {
    if (!row.diskName.empty()) logical = row.name;
  }
  ASSERT_NE(logical, "");
  EXPECT_EQ(throwAway(at(logical)), inTrash(logical));
  EXPECT_EQ(fs::exists(at("e\xcc\x81")) + fs::exists(at("\xc3\xa9")), 1);
}

TEST_F(TrashTest, ForgetsWhereItemsWereThatHaveOneTextForAName) {
  const std::string first = "e\xcc\x81";
  const std::string second = "\xc3\xa9";
  write(first);
  write(second);
  scan();
  for (const std::string& name : {first, second}) {
    std::ofstream(infoOf(name)) << "[Trash Info]\nPath=" << at(name) << "\n";
    fs::rename(at(name), inTrash(name));
    scan();
  }
  for (const std::string& name : {first, second}) {
    fs::rename(inTrash(name), at(name));
    scan();
    EXPECT_TRUE(comesTrue([&] { return !fs::exists(infoOf(name)); })) << name;
  }
}

TEST_F(TrashTest, TakesNothingWhereItCannotSeeWhatItHas) {
  write("a");
  scan();
  fs::remove(layout.trashFiles());
  std::ofstream(layout.trashFiles()) << "somebody's";
  NSErrorRef error;
  EXPECT_EQ(throwAway(at("a"), &error), "");
  EXPECT_NE(error, nullptr);
  EXPECT_TRUE(fs::exists(at("a")));
}

TEST_F(TrashTest, RemembersTheContainer) {
  makeContainer("org.example.Notes", "Notes");
  const std::string documents = layout.documents("org.example.Notes");
  fs::create_directory(documents + "/sub");
  std::ofstream(documents + "/sub/note") << "x";
  EXPECT_EQ(throwAway(documents + "/sub/note"), inTrash("note"));
  const auto info = parseTrashInfo(contentOf(infoOf("note")));
  ASSERT_TRUE(info.has_value());
  EXPECT_EQ(info->path, "Notes/sub/note");
  EXPECT_EQ(info->containerID, "org.example.Notes");
  EXPECT_EQ(putBack(inTrash("note")), documents + "/sub/note");
}

TEST_F(TrashTest, ReadsWhereOthersTookItemsFrom) {
  makeContainer("org.example.Notes", "Notes");
  const std::pair<std::string, std::string> cases[] = {
      {"sub/x", at("sub/x")}, {"Notes/x", layout.documents("org.example.Notes") + "/x"},
      {"Notes", at("Notes")}, {at("abs"), at("abs")},
      {"/etc/passwd", ""},    {layout.promises() + "/x", ""},
      {inTrash("y"), ""}};
  int number = 0;
  for (const auto& [path, expected] : cases) {
    const std::string name = "item" + std::to_string(++number);
    std::ofstream(inTrash(name)) << "x";
    std::ofstream(infoOf(name)) << "[Trash Info]\nPath=" << path << "\n";
    EXPECT_EQ(putBack(inTrash(name)), expected) << path;
  }
}

TEST_F(TrashTest, TrustsNoContainerThatLeadsOutOfTheTree) {
  for (const char* id : {"..", "../../x", ".Trash", ".Promises", "a/Documents/b"}) {
    std::ofstream(inTrash("x")) << "x";
    TrashInfo info;
    info.path = "x";
    info.containerID = id;
    info.pathInContainer = "x";
    std::ofstream(infoOf("x")) << trashInfoText(info);
    EXPECT_EQ(putBack(inTrash("x")), "") << id;
  }
}

TEST_F(TrashTest, ListsWhatOthersPutThereButKnowsNoWayBack) {
  std::ofstream(inTrash("found.txt")) << "x";
  scan();
  EXPECT_THAT(names(kTrashID), ElementsAre("found.txt"));
  NSErrorRef error;
  EXPECT_EQ(putBack(inTrash("found.txt"), &error), "");
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSFileNoSuchFileError)) << error->description();
  EXPECT_THAT(error->localizedDescription(), HasSubstr("does not know"));
}

TEST_F(TrashTest, DropsTheInformationAboutWhatIsPutBack) {
  write("a.txt");
  throwAway(at("a.txt"));
  ASSERT_EQ(::rename(inTrash("a.txt").c_str(), at("a.txt").c_str()), 0);
  ASSERT_TRUE(scanner->scanLocation(at("a.txt")).has_value());
  EXPECT_FALSE(row("a.txt")->isTrashed());
  EXPECT_TRUE(comesTrue([&] { return !fs::exists(infoOf("a.txt")); }));
}

TEST_F(TrashTest, DropsTheInformationAboutWhatOthersDelete) {
  write("a.txt");
  write("b.txt");
  throwAway(at("a.txt"));
  throwAway(at("b.txt"));
  fs::remove(inTrash("a.txt"));
  ASSERT_EQ(scanner->scanFolders({kTrashID}), nullptr);
  EXPECT_TRUE(comesTrue([&] { return !fs::exists(infoOf("a.txt")); }));
  EXPECT_TRUE(fs::exists(infoOf("b.txt")));
}

TEST_F(TrashTest, TakesTheInformationAlongWhenAnItemIsRenamedInTheTrash) {
  write("a.txt");
  throwAway(at("a.txt"));
  ASSERT_EQ(::rename(inTrash("a.txt").c_str(), inTrash("b.txt").c_str()), 0);
  ASSERT_EQ(scanner->scanFolders({kTrashID}), nullptr);
  EXPECT_TRUE(comesTrue([&] { return fs::exists(infoOf("b.txt")); }));
  EXPECT_EQ(putBack(inTrash("b.txt")), at("a.txt"));
}

TEST_F(TrashTest, RefusesTheDriveItself) {
  NSErrorRef error;
  EXPECT_EQ(throwAway(layout.root(), &error), "");
  expectRefused(error, EPERM);
  EXPECT_EQ(throwAway(layout.trashFiles(), &error), "");
  expectRefused(error, EINVAL);
}

TEST_F(TrashTest, RefusesAnApplicationsFolder) {
  makeContainer("org.example.Notes", "Notes");
  NSErrorRef error;
  EXPECT_EQ(throwAway(layout.documents("org.example.Notes"), &error), "");
  expectRefused(error, EPERM);
  EXPECT_TRUE(fs::exists(layout.documents("org.example.Notes")));
}

TEST_F(TrashTest, RefusesPrivatePlaces) {
  std::ofstream(layout.privateArea() + "/staged") << "x";
  std::ofstream(layout.promises() + "/7") << "x";
  for (const std::string& path :
       {layout.privateArea() + "/staged", layout.promises() + "/7", layout.trashInfo(),
        layout.containerFolder(QSUbiquitousDefaultContainerID)}) {
    NSErrorRef error;
    EXPECT_EQ(throwAway(path, &error), "") << path;
    expectRefused(error, EPERM);
    EXPECT_TRUE(fs::exists(path));
  }
}

TEST_F(TrashTest, RefusesWhatIsInTheTrashAlready) {
  makeFolder("a");
  write("a/b");
  throwAway(at("a"));
  for (const char* path : {"a", "a/b"}) {
    NSErrorRef error;
    EXPECT_EQ(throwAway(inTrash(path), &error), "");
    expectRefused(error, EINVAL);
  }
}

TEST_F(TrashTest, RefusesWhatIsOutsideTheTree) {
  for (const std::string& path : {std::string("/etc/passwd"), std::string(), std::string("a"),
                                  at("a") + '\0' + "b", layout.home() + "/tree/../x"}) {
    NSErrorRef error;
    EXPECT_EQ(throwAway(path, &error), "");
    ASSERT_NE(error, nullptr);
    const bool isOutside = error->is(QSOstrellErrorDomain, QSOstrellErrorInvalidParameter);
    const bool isPrivate = error->is(NSCocoaErrorDomain, NSFileWriteUnknownError);
    EXPECT_TRUE(isOutside || isPrivate) << error->description();
  }
}

TEST_F(TrashTest, SaysThatThereIsNothing) {
  NSErrorRef error;
  EXPECT_EQ(throwAway(at("nothing"), &error), "");
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSFileNoSuchFileError)) << error->description();
  EXPECT_THAT(namesIn(layout.trashInfo()), IsEmpty());
}

TEST_F(TrashTest, LeavesEverythingWhereItWasAfterAFailure) {
  write("a.txt");
  ASSERT_EQ(FaultPoint::arm("zarn.trash.after-info=error"), nullptr);
  NSErrorRef error;
  EXPECT_EQ(throwAway(at("a.txt"), &error), "");
  expectRefused(error, EIO);
  EXPECT_TRUE(fs::exists(at("a.txt")));
  EXPECT_THAT(namesIn(layout.trashInfo()), IsEmpty());
  FaultPoint::disarmAll();
  EXPECT_EQ(throwAway(at("a.txt")), inTrash("a.txt"));
}

TEST_F(TrashTest, LeavesAnItemWhereItIsWhenTheCallWasDropped) {
  write("a.txt");
  NSErrorRef error;
  EXPECT_FALSE(trash->trash(at("a.txt"), [] { return true; }, &error).has_value());
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSUserCancelledError));
  EXPECT_TRUE(fs::exists(at("a.txt")));
}

TEST_F(TrashTest, AnswersForAnItemThatIsNotInTheTrash) {
  write("a.txt");
  NSErrorRef error;
  EXPECT_EQ(putBack(at("a.txt"), &error), "");
  expectRefused(error, EINVAL);
  EXPECT_EQ(putBack(inTrash("nothing"), &error), "");
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSFileNoSuchFileError)) << error->description();
}

TEST_F(TrashTest, RemovesInformationThatAKilledProcessLeft) {
  write("a.txt");
  throwAway(at("a.txt"));
  TrashInfo info;
  info.path = info.pathInContainer = "b.txt";
  info.containerID = QSUbiquitousDefaultContainerID;
  std::ofstream(infoOf("b.txt")) << trashInfoText(info);
  std::ofstream(infoOf("coming.txt")) << "[Trash Info]\nPath=coming.txt\n";
  std::ofstream(infoOf("old.txt")) << "[Trash Info]\nPath=old.txt\n";
  fs::last_write_time(infoOf("old.txt"),
                      fs::file_time_type::clock::now() - std::chrono::minutes(2));
  trash->recover();
  // What another program may be about to use is left alone.
  EXPECT_THAT(namesIn(layout.trashInfo()), ElementsAre("a.txt.trashinfo", "coming.txt.trashinfo"));
}

TEST_F(TrashTest, RemovesWhatWasEmptiedWhenAProcessWasKilled) {
  const std::string staging = layout.privateArea() + "/emptied-abcdef";
  fs::create_directories(staging + "/0/deep");
  std::ofstream(staging + "/0/deep/file") << "x";
  std::ofstream(layout.privateArea() + "/others") << "x";
  trash->recover();
  EXPECT_TRUE(comesTrue([&] { return !fs::exists(staging); }));
  EXPECT_TRUE(fs::exists(layout.privateArea() + "/others"));
}

// --- Emptying.

TEST_F(TrashTest, EmptiesItself) {
  makeFolder("a");
  makeFolder("a/b");
  write("a/b/c");
  write("d");
  fs::create_symlink("/", at("a/b/everything"));
  scan();
  const std::uint64_t inside = id("a/b/c");
  throwAway(at("a"));
  throwAway(at("d"));
  std::ofstream(inTrash("others")) << "x";
  std::ofstream(inTrash("never.nosync")) << "x";
  NSErrorRef error;
  EXPECT_EQ(trash->empty(never, &error), 7U);
  EXPECT_EQ(error, nullptr);
  EXPECT_THAT(namesIn(layout.trashFiles()), IsEmpty());
  EXPECT_THAT(namesIn(layout.trashInfo()), IsEmpty());
  EXPECT_THAT(namesIn(layout.privateArea()), IsEmpty());
  EXPECT_THAT(names(kTrashID), IsEmpty());
  EXPECT_FALSE(store->itemByID(inside).has_value());
}

TEST_F(TrashTest, HasNothingToRemoveWhenItIsEmpty) {
  NSErrorRef error;
  EXPECT_EQ(trash->empty(never, &error), 0U);
  EXPECT_EQ(error, nullptr);
}

TEST_F(TrashTest, EmptiesTreesDeeperThanPathsCanSay) {
  constexpr int kDepth = 3'000;
  int folder = ::open(layout.trashFiles().c_str(), O_RDONLY | O_DIRECTORY);
  for (int i = 0; i < kDepth; ++i) {
    ASSERT_EQ(mkdirat(folder, "down", 0700), 0);
    const int next = openat(folder, "down", O_RDONLY | O_DIRECTORY);
    ASSERT_GE(next, 0);
    ::close(folder);
    folder = next;
  }
  ::close(openat(folder, "file", O_CREAT | O_WRONLY, 0600));
  ::close(folder);
  NSErrorRef error;
  EXPECT_EQ(trash->empty(never, &error), kDepth + 1U);
  EXPECT_EQ(error, nullptr);
  EXPECT_THAT(namesIn(layout.privateArea()), IsEmpty());
}

TEST_F(TrashTest, EmptiesFoldersThatMayNotBeWritten) {
  makeFolder("a");
  makeFolder("a/b");
  write("a/b/c");
  fs::permissions(at("a/b"), fs::perms::owner_read);
  throwAway(at("a"));
  NSErrorRef error;
  EXPECT_EQ(trash->empty(never, &error), 3U);
  EXPECT_EQ(error, nullptr);
}

TEST_F(TrashTest, StopsEmptyingWhenTheCallIsDropped) {
  for (int i = 0; i < 3; ++i) {
    write(std::to_string(i));
    throwAway(at(std::to_string(i)));
  }
  int asked = 0;
  NSErrorRef error;
  EXPECT_EQ(trash->empty([&] { return ++asked > 1; }, &error), 1U);
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSUserCancelledError));
  EXPECT_EQ(namesIn(layout.trashFiles()).size(), 2U);
  EXPECT_EQ(names(kTrashID).size(), 2U);
}

TEST_F(TrashTest, ServesManyAtOnce) {
  constexpr int kThreads = 4;
  constexpr int kItems = 20;
  for (int t = 0; t < kThreads; ++t) {
    makeFolder(std::to_string(t));
    for (int i = 0; i < kItems; ++i) write(std::to_string(t) + "/" + std::to_string(i));
  }
  scan();
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&, t] {
      for (int i = 0; i < kItems; ++i) {
        EXPECT_NE(throwAway(at(std::to_string(t) + "/" + std::to_string(i))), "");
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(names(kTrashID).size(), std::size_t{kThreads * kItems});
  EXPECT_EQ(namesIn(layout.trashInfo()).size(), std::size_t{kThreads * kItems});
  NSErrorRef error;
  EXPECT_EQ(trash->empty(never, &error), std::uint64_t{kThreads * kItems});
}

}  // namespace
}  // namespace yomber
