#include "zarn/item_store.h"

#include "platform/ostrell/constants.h"
#include "zarn/test_drive.h"

namespace yomber {
namespace {

class ItemStoreTest : public TestDrive {};

const std::vector<ContainerFolder> kContainers{
    {QSUbiquitousDefaultContainerID, "Drive"},
    {QSUbiquitousDocumentsContainerID, "Documents"},
    {"org.example.Notes", "Notes"},
    {"org.example.Other", "Notes"},
};

TEST_F(ItemStoreTest, ResolvesLocationsBothWays) {
  makeFolder("a");
  write("a/b");
  scan();
  const auto b = row("a/b");
  ASSERT_TRUE(b);
  EXPECT_EQ(store->logicalPath(b->id), at("a/b"));
  EXPECT_EQ(store->physicalPath(b->id), at("a/b"));
  EXPECT_EQ(store->itemAtPath(layout.root())->id, kRootID);
  EXPECT_EQ(store->logicalPath(kRootID), layout.root());
  EXPECT_EQ(store->logicalPath(kTrashID), layout.trashFiles());
  EXPECT_EQ(store->ancestors(b->id), (std::vector<std::uint64_t>{id("a"), kRootID}));
  EXPECT_FALSE(store->itemAtPath(at("a/missing")));
  EXPECT_FALSE(store->itemAtPath(layout.privateArea()));
  EXPECT_FALSE(store->logicalPath(123456789));
}

TEST_F(ItemStoreTest, ContainersHaveFoldersWithNamesOfTheirOwn) {
  write("Notes");
  ASSERT_EQ(store->setContainers(kContainers), nullptr);
  scan();
  const auto notes = store->itemForContainer("org.example.Notes");
  const auto other = store->itemForContainer("org.example.Other");
  ASSERT_TRUE(notes && other);
  EXPECT_EQ(notes->parent, kRootID);
  EXPECT_TRUE(notes->isContainerFolder());
  const auto found = names();
  EXPECT_EQ(found, (std::vector<std::string>{"Notes", "Notes 2", "Notes 3"}));
  EXPECT_EQ(store->itemForContainer(QSUbiquitousDefaultContainerID)->id, kRootID);
  EXPECT_FALSE(store->itemForContainer("org.example.Unknown"));
  EXPECT_EQ(store->physicalPath(notes->id), layout.documents("org.example.Notes"));
  // The file keeps its own location; by path, containers are where they are on disk.
  EXPECT_EQ(store->itemAtPath(at("Notes"))->kind, ItemKind::Document);
  EXPECT_EQ(store->itemAtPath(layout.documents("org.example.Notes"))->id, notes->id);
}

TEST_F(ItemStoreTest, ContainersAreScannedAndSurviveScansAndRestarts) {
  ASSERT_EQ(store->setContainers(kContainers), nullptr);
  std::ofstream(layout.documents("org.example.Notes") + "/page.md") << "text";
  scan();
  const auto notes = store->itemForContainer("org.example.Notes");
  const auto page = store->itemAtPath(layout.documents("org.example.Notes") + "/page.md");
  ASSERT_TRUE(notes && page);
  EXPECT_EQ(page->parent, notes->id);
  reopen();
  ASSERT_EQ(store->setContainers(kContainers), nullptr);
  scan();
  EXPECT_EQ(scan().changes, 0U);
  EXPECT_EQ(store->itemForContainer("org.example.Notes")->id, notes->id);
  EXPECT_EQ(scanner->scanLocation(layout.documents("org.example.Notes") + "/page.md")->id,
            page->id);
  ASSERT_EQ(scanner->scanFolders({kRootID, notes->id}), nullptr);
  EXPECT_EQ(store->itemForContainer("org.example.Notes")->id, notes->id);
}

TEST_F(ItemStoreTest, AContainerThatIsGoneLosesItsFolderButNotItsFiles) {
  ASSERT_EQ(store->setContainers(kContainers), nullptr);
  std::ofstream(layout.documents("org.example.Notes") + "/page.md") << "text";
  scan();
  const auto page = store->itemAtPath(layout.documents("org.example.Notes") + "/page.md");
  ASSERT_EQ(store->setContainers({}), nullptr);
  EXPECT_TRUE(names().empty());
  EXPECT_FALSE(store->itemByID(page->id));
  EXPECT_TRUE(std::filesystem::exists(layout.documents("org.example.Notes") + "/page.md"));
}

TEST_F(ItemStoreTest, RefusesContainersThatWouldLeaveTheTree) {
  for (const char* id : {"", "..", ".Trash", "a/b", "../../x"}) {
    EXPECT_EQ(store->setContainers({{id, "Bad"}}), nullptr) << id;
  }
  scan();
  EXPECT_TRUE(names().empty());
  EXPECT_FALSE(std::filesystem::exists(layout.home() + "/x"));
}

TEST_F(ItemStoreTest, CountsLeaveOutTheDrivesOwnFolders) {
  scan();
  EXPECT_EQ(store->counts().items, 0U);
  makeFolder("a");
  write("a/b");
  scan();
  EXPECT_EQ(store->counts().items, 2U);
  EXPECT_EQ(store->counts().folders, 1U);
}

}  // namespace
}  // namespace yomber
