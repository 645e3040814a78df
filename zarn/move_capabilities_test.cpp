#include "zarn/move_capabilities.h"

#include <gmock/gmock.h>

#include "platform/ostrell/constants.h"
#include "platform/ostrell/move_capability.h"
#include "zarn/test_drive.h"

namespace yomber {
namespace {

namespace fs = std::filesystem;

class MoveCapabilitiesTest : public TestDrive {
 protected:
  MoveCapabilitiesTest() {
    const std::shared_ptr<Scanner> shared(scanner.get(), [](Scanner*) {});
    trash = Trash::create(store, shared);
    moves.emplace(store, shared, trash);
    makeFolder("folder");
    makeFolder("folder/below");
    write("a.txt");
    write("folder/b.txt");
    scan();
    EXPECT_EQ(store->setContainers({{"org.example.Notes", "Notes"}, {"org.example.Art", "Art"}}),
              nullptr);
    notes = layout.documents("org.example.Notes");
    art = layout.documents("org.example.Art");
    std::ofstream(notes + "/note.txt") << "x";
  }

  std::uint32_t move(const std::string& source, const std::string& destination) {
    failure = nullptr;
    const std::uint32_t capability = moves->capability(source, destination, &failure);
    const bool isAllowed = (capability & QSMoveCapabilityAllowedMask) != 0;
    EXPECT_EQ(isAllowed, failure == nullptr) << source << " " << destination;
    return capability;
  }
  std::string throwAway(const std::string& path) {
    return trash->trash(path, [] { return false; }, &failure).value_or("");
  }
  void expectFailure(const char* domain, std::int64_t code) const {
    ASSERT_NE(failure, nullptr);
    EXPECT_TRUE(failure->is(domain, code)) << failure->description();
  }
  void expectRefused(int number) const {
    expectFailure(NSCocoaErrorDomain, NSFileWriteUnknownError);
    ASSERT_NE(failure->underlyingError(), nullptr);
    EXPECT_EQ(failure->underlyingError()->code(), number);
  }

  std::shared_ptr<Trash> trash;
  std::optional<MoveCapabilities> moves;
  std::string notes;
  std::string art;
  NSErrorRef failure;
};

TEST_F(MoveCapabilitiesTest, ArePlainWithinAContainer) {
  EXPECT_EQ(move(at("a.txt"), at("folder/a.txt")), QSMoveCapabilityWithinContainer);
  EXPECT_EQ(move(at("a.txt"), at("renamed.txt")), QSMoveCapabilityWithinContainer);
  EXPECT_EQ(move(at("a.txt"), at("a.txt")), QSMoveCapabilityWithinContainer);
  EXPECT_EQ(move(at("folder"), at("elsewhere")), QSMoveCapabilityWithinContainer);
  EXPECT_EQ(move(notes + "/note.txt", notes + "/other.txt"), QSMoveCapabilityWithinContainer);
}

TEST_F(MoveCapabilitiesTest, NeedTheContentBetweenContainers) {
  for (const auto& [source, destination] :
       {std::pair(at("a.txt"), notes + "/a.txt"), std::pair(notes + "/note.txt", at("note.txt")),
        std::pair(notes + "/note.txt", art + "/note.txt")}) {
    EXPECT_EQ(move(source, destination), QSMoveCapabilityAcrossContainers);
  }
  EXPECT_NE(QSMoveCapabilityAcrossContainers & QSMoveCapabilityNeedsContentMask, 0U);
}

TEST_F(MoveCapabilitiesTest, TellSharedFoldersApart) {
  for (const char* name : {"shared", "also"}) {
    makeFolder(name);
    makeFolder(std::string(name) + "/deep");
    write(std::string(name) + "/deep/x");
    setAttribute(name, kSharedAttribute, "1");
  }
  scan();
  EXPECT_EQ(move(at("shared/deep/x"), at("shared/x")), QSMoveCapabilityWithinSharedZone);
  EXPECT_EQ(move(at("shared/deep/x"), at("x")), QSMoveCapabilityOutOfSharedZone);
  EXPECT_EQ(move(at("a.txt"), at("shared/deep/a.txt")), QSMoveCapabilityIntoSharedZone);
  EXPECT_EQ(move(at("shared/deep/x"), at("also/x")), QSMoveCapabilityAcrossSharedZones);
  EXPECT_EQ(move(at("shared"), at("folder/shared")), QSMoveCapabilityWithinContainer);
}

TEST_F(MoveCapabilitiesTest, TakeItemsToTheTrashAndBack) {
  EXPECT_EQ(move(at("a.txt"), layout.trashFiles() + "/a.txt"), QSMoveCapabilityToTrash);
  const std::string trashed = throwAway(at("a.txt"));
  EXPECT_EQ(move(trashed, at("a.txt")), QSMoveCapabilityFromTrash);
  EXPECT_EQ(move(trashed, notes + "/a.txt"), QSMoveCapabilityFromTrashAcrossContainers);
  EXPECT_EQ(move(trashed, layout.trashFiles() + "/b.txt"), QSMoveCapabilityWithinContainer);
  const std::string note = throwAway(notes + "/note.txt");
  EXPECT_EQ(move(note, notes + "/note.txt"), QSMoveCapabilityFromTrash);
  EXPECT_EQ(move(note, at("note.txt")), QSMoveCapabilityFromTrashAcrossContainers);
}

TEST_F(MoveCapabilitiesTest, TakeWhatOthersTrashedForTheDrivesOwn) {
  std::ofstream(layout.trashFiles() + "/found") << "x";
  EXPECT_EQ(move(layout.trashFiles() + "/found", at("found")), QSMoveCapabilityFromTrash);
}

TEST_F(MoveCapabilitiesTest, RefuseAFolderIntoItself) {
  for (const char* destination : {"folder/folder", "folder/below/folder"}) {
    EXPECT_EQ(move(at("folder"), at(destination)), QSMoveCapabilityRefusedIntoItself);
    expectRefused(EINVAL);
  }
}

TEST_F(MoveCapabilitiesTest, RefuseWhatHasItsFixedPlace) {
  for (const std::string& source : {layout.root(), layout.trashFiles(), notes}) {
    EXPECT_EQ(move(source, at("folder/x")), QSMoveCapabilityRefusedFixedItem);
    expectRefused(EPERM);
  }
}

TEST_F(MoveCapabilitiesTest, RefuseThePlacesOfTheDrive) {
  for (const std::string& destination :
       {layout.promises() + "/1", layout.privateArea() + "/x", layout.trashInfo() + "/x", notes,
        layout.root(), layout.trashFiles(), layout.containerFolder("org.example.Notes") + "/x"}) {
    EXPECT_EQ(move(at("a.txt"), destination), QSMoveCapabilityRefusedLocation) << destination;
    expectRefused(EPERM);
  }
  EXPECT_EQ(move(at("a.txt"), at("folder/b.txt/a.txt")), QSMoveCapabilityRefusedLocation);
  expectRefused(ENOTDIR);
}

TEST_F(MoveCapabilitiesTest, NeedTheContentWhereNothingSyncs) {
  EXPECT_EQ(move(at("a.txt"), "/somewhere/else/a.txt"), QSMoveCapabilityOutOfSync);
  EXPECT_EQ(move(at("a.txt"), at("a.txt.nosync")), QSMoveCapabilityOutOfSync);
}

TEST_F(MoveCapabilitiesTest, AllowWhatNeverSynced) {
  write("x.nosync");
  EXPECT_EQ(move(at("x.nosync"), at("folder/x")), QSMoveCapabilityNeverSynced);
  EXPECT_EQ(move(at("gone.nosync"), at("folder/x")), 0U);
  expectFailure(NSCocoaErrorDomain, NSFileNoSuchFileError);
  EXPECT_EQ(move(at("x.nosync"), layout.promises() + "/x"), QSMoveCapabilityRefusedLocation);
}

TEST_F(MoveCapabilitiesTest, SayWhatIsMissing) {
  EXPECT_EQ(move(at("nothing"), at("folder/nothing")), 0U);
  expectFailure(NSCocoaErrorDomain, NSFileNoSuchFileError);
  EXPECT_EQ(move(at("a.txt"), at("no folder/a.txt")), 0U);
  expectFailure(NSCocoaErrorDomain, NSFileNoSuchFileError);
  EXPECT_EQ(move("/etc/passwd", at("passwd")), 0U);
  expectFailure(QSOstrellErrorDomain, QSOstrellErrorInvalidParameter);
  EXPECT_EQ(move("", ""), 0U);
  expectFailure(QSOstrellErrorDomain, QSOstrellErrorInvalidParameter);
}

TEST_F(MoveCapabilitiesTest, SeeWhatIsOnDiskAtTheMoment) {
  makeFolder("new");
  write("fresh");
  EXPECT_EQ(move(at("fresh"), at("new/fresh")), QSMoveCapabilityWithinContainer);
  rename("fresh", "new/fresh");
  EXPECT_EQ(move(at("fresh"), at("folder/fresh")), 0U);
}

/// What a client is shown may be done, and what may not is refused.
TEST_F(MoveCapabilitiesTest, AgreeWithWhatItemsSayOfThemselves) {
  const std::string trashed = throwAway(at("folder/b.txt"));
  const std::string destination = at("folder/x");
  for (const std::string& path :
       {at("a.txt"), at("folder/below"), notes, layout.root(), layout.trashFiles(), trashed}) {
    const auto item = scanner->scanLocation(path);
    ASSERT_TRUE(item.has_value()) << path;
    const std::uint32_t capabilities = itemCapabilities(*item);
    const bool mayMove = (capabilities & NSFileProviderItemCapabilitiesAllowsReparenting) != 0;
    const bool isAllowed = (move(path, destination) & QSMoveCapabilityAllowedMask) != 0;
    EXPECT_EQ(mayMove, isAllowed) << path;
    const bool mayTrash = (capabilities & NSFileProviderItemCapabilitiesAllowsTrashing) != 0;
    EXPECT_EQ(mayTrash, !throwAway(path).empty()) << path;
  }
}

}  // namespace
}  // namespace yomber
