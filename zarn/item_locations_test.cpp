#include "zarn/item_locations.h"

#include <gmock/gmock.h>

#include "platform/ostrell/constants.h"
#include "zarn/test_drive.h"

namespace yomber {
namespace {

namespace fs = std::filesystem;
using testing::ElementsAre;
using testing::HasSubstr;
using Recreate = ItemLocations::Recreate;

class ItemLocationsTest : public TestDrive {
 protected:
  ItemLocationsTest() {
    const std::string applications = layout.home() + "-applications";
    fs::create_directory(applications);
    std::ofstream(applications + "/org.example.Notes.desktop")
        << "[Desktop Entry]\nType=Application\nName=Notes\nExec=notes\n"
           "X-Yomber-Container=org.example.Notes\n";
    containers = std::make_shared<Containers>(std::vector<std::string>{applications}, layout);
    scan();
    EXPECT_EQ(containers->start(
                  {.apply = [this](const auto& folders) { return store->setContainers(folders); },
                   .didChange = {}}),
              nullptr);
    locations.emplace(store, std::shared_ptr<Scanner>(scanner.get(), [](Scanner*) {}), containers);
  }
  ~ItemLocationsTest() override { containers->stop(); }

  std::string physical(const std::string& path) {
    failure = nullptr;
    return locations->physicalLocation(path, &failure).value_or("");
  }
  std::string container(const std::string& id, Recreate recreate) {
    failure = nullptr;
    const auto found = locations->containerLocation(id, recreate, &failure);
    EXPECT_EQ(found.has_value(), failure == nullptr);
    return found ? found->documents : "";
  }
  void expectFailure(const char* domain, std::int64_t code) const {
    ASSERT_NE(failure, nullptr);
    EXPECT_TRUE(failure->is(domain, code)) << failure->description();
  }

  std::shared_ptr<Containers> containers;
  std::optional<ItemLocations> locations;
  NSErrorRef failure;
};

TEST_F(ItemLocationsTest, NearlyAlwaysAreTheSame) {
  makeFolder("folder");
  write("folder/a.txt");
  EXPECT_EQ(physical(at("folder/a.txt")), at("folder/a.txt"));
  EXPECT_EQ(physical(layout.root()), layout.root());
}

TEST_F(ItemLocationsTest, DifferWhereTheDiskHasAnotherName) {
  makeFolder("e\xcc\x81");
  makeFolder("\xc3\xa9");
  write("e\xcc\x81/x");
  write("\xc3\xa9/x");
  scan();
  int differing = 0;
  for (const ItemRow& folder : store->children(kRootID)) {
    if (folder.isContainerFolder()) continue;
    EXPECT_EQ(physical(at(folder.name + "/x")), at(folder.nameOnDisk() + "/x"));
    EXPECT_TRUE(fs::exists(physical(at(folder.name + "/x"))));
    differing += folder.diskName.empty() ? 0 : 1;
  }
  EXPECT_EQ(differing, 1);
}

TEST_F(ItemLocationsTest, SayWhatIsMissingOrOutside) {
  EXPECT_EQ(physical(at("nothing")), "");
  expectFailure(NSCocoaErrorDomain, NSFileNoSuchFileError);
  EXPECT_EQ(physical("/etc/passwd"), "");
  expectFailure(QSOstrellErrorDomain, QSOstrellErrorInvalidParameter);
}

TEST_F(ItemLocationsTest, TellAContainersFolder) {
  EXPECT_EQ(container("org.example.Notes", Recreate::No), layout.documents("org.example.Notes"));
  EXPECT_EQ(container(QSUbiquitousDefaultContainerID, Recreate::No), layout.root());
  const auto found = locations->containerLocation("org.example.Notes", Recreate::No, nullptr);
  EXPECT_EQ(found->displayName, "Notes");
  EXPECT_EQ(found->generation, containers->list()->generation);
}

TEST_F(ItemLocationsTest, MakeDocumentsOnlyWhenAsked) {
  EXPECT_EQ(container(QSUbiquitousDocumentsContainerID, Recreate::No), "");
  expectFailure(NSCocoaErrorDomain, NSFileNoSuchFileError);
  EXPECT_EQ(container(QSUbiquitousDocumentsContainerID, Recreate::Yes), at("Documents"));
  const auto made = row("Documents");
  ASSERT_TRUE(made.has_value());
  EXPECT_TRUE(made->isFolder());
  EXPECT_EQ(container(QSUbiquitousDocumentsContainerID, Recreate::Yes), at("Documents"));
  EXPECT_EQ(id("Documents"), made->id);
}

TEST_F(ItemLocationsTest, BringAnApplicationsFolderBackUnderItsOldIdentity) {
  const std::string documents = layout.documents("org.example.Notes");
  std::ofstream(documents + "/old") << "x";
  ASSERT_TRUE(scanner->scanLocation(documents + "/old").has_value());
  const auto before = store->itemForContainer("org.example.Notes");
  fs::remove_all(layout.containerFolder("org.example.Notes"));
  EXPECT_EQ(container("org.example.Notes", Recreate::No), "");
  expectFailure(NSCocoaErrorDomain, NSFileNoSuchFileError);
  EXPECT_EQ(container("org.example.Notes", Recreate::Yes), documents);
  const auto after = store->itemForContainer("org.example.Notes");
  ASSERT_TRUE(after.has_value());
  EXPECT_EQ(after->id, before->id);
  struct stat status{};
  ASSERT_EQ(lstat(documents.c_str(), &status), 0);
  EXPECT_EQ(after->inode, status.st_ino);
  EXPECT_FALSE(store->itemAtPath(documents + "/old").has_value());
}

TEST_F(ItemLocationsTest, RefuseWhereSomethingElseHasThePlace) {
  write("Documents", "a file");
  EXPECT_EQ(container(QSUbiquitousDocumentsContainerID, Recreate::Yes), "");
  expectFailure(NSCocoaErrorDomain, NSFileWriteFileExistsError);
  EXPECT_THAT(failure->localizedDescription(), HasSubstr("rename it"));
  EXPECT_TRUE(fs::is_regular_file(at("Documents")));
}

TEST_F(ItemLocationsTest, RefuseContainersThatNobodyHas) {
  for (const char* id : {"org.example.Unknown", "", "..", "../..", "a/b"}) {
    EXPECT_EQ(container(id, Recreate::Yes), "");
    expectFailure(QSOstrellErrorDomain, QSOstrellErrorInvalidParameter);
  }
  EXPECT_FALSE(fs::exists(layout.containerFolder("org.example.Unknown")));
}

}  // namespace
}  // namespace yomber
