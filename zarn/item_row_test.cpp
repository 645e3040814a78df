#include "zarn/item_row.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

namespace yomber {
namespace {

TEST(ItemRow, IdentifiersGoThereAndBack) {
  EXPECT_EQ(itemIdentifier(kRootID, ItemKind::Folder), NSFileProviderRootContainerItemIdentifier);
  EXPECT_EQ(itemIdentifier(kTrashID, ItemKind::Folder), NSFileProviderTrashContainerItemIdentifier);
  for (const ItemKind kind : {ItemKind::Document, ItemKind::Folder, ItemKind::Alias,
                              ItemKind::Bookmark, ItemKind::Symlink}) {
    EXPECT_EQ(rawIDFromIdentifier(itemIdentifier(987654321, kind)), 987654321U);
  }
  EXPECT_EQ(itemIdentifier(5000, ItemKind::Bookmark), "d:5000");
  EXPECT_EQ(itemIdentifier(5000, ItemKind::Folder), "i:5000");
  EXPECT_EQ(rawIDFromIdentifier("i:9223372036854775807"), 9223372036854775807U);
}

TEST(ItemRow, RefusesMalformedIdentifiers) {
  for (const char* text :
       {"", "d", "d:", "x:5000", "d:-5000", "d: 5000", "d:5000 ", "d:05000", "d:0", "d:1",
        "d:9223372036854775808", "d:99999999999999999999", "5000"}) {
    EXPECT_FALSE(rawIDFromIdentifier(text)) << text;
  }
}

TEST(ItemRow, ContainersFoldersCannotBeArranged) {
  constexpr std::uint32_t kArranging = NSFileProviderItemCapabilitiesAllowsRenaming |
                                       NSFileProviderItemCapabilitiesAllowsReparenting |
                                       NSFileProviderItemCapabilitiesAllowsTrashing |
                                       NSFileProviderItemCapabilitiesAllowsDeleting;
  ItemRow row;
  row.id = 5000;
  row.kind = ItemKind::Folder;
  row.mode = S_IFDIR | 0700;
  EXPECT_EQ(itemCapabilities(row) & kArranging, kArranging);
  EXPECT_TRUE(itemCapabilities(row) & NSFileProviderItemCapabilitiesAllowsAddingSubItems);
  ItemExtra extra;
  extra.containerID = "org.example.Notes";
  row.extra = std::make_shared<const ItemExtra>(extra);
  EXPECT_EQ(itemCapabilities(row) & kArranging, 0U);
  EXPECT_TRUE(itemCapabilities(row) & NSFileProviderItemCapabilitiesAllowsAddingSubItems);
}

TEST(ItemRow, VersionsChangeWithTheContent) {
  ItemRow row;
  row.mtime = 1;
  row.size = 10;
  row.inode = 3;
  const std::uint64_t version = itemVersion(row);
  ItemRow renamed = row;
  renamed.name = "other";
  renamed.rank = 99;
  EXPECT_EQ(itemVersion(renamed), version);
  ItemRow touched = row;
  touched.mtime = 2;
  EXPECT_NE(itemVersion(touched), version);
  ItemRow grown = row;
  grown.size = 11;
  EXPECT_NE(itemVersion(grown), version);
}

TEST(ItemRow, FieldsCarryWhatTheRowHas) {
  ItemRow row;
  row.id = 5000;
  row.parent = kRootID;
  row.name = ".notes.txt";
  row.flags = row_flag::kDownloaded | row_flag::kStamped | row_flag::kHasExtra;
  row.mode = S_IFREG | 0400;
  row.mtime = 7;
  ItemExtra extra;
  extra.tags = {"red", "work"};
  extra.favoriteRank = 3;
  row.extra = std::make_shared<const ItemExtra>(extra);
  const ItemFields fields = itemFields(row);
  EXPECT_EQ(fields.identifier, "d:5000");
  EXPECT_EQ(fields.parentIdentifier, NSFileProviderRootContainerItemIdentifier);
  EXPECT_EQ(fields.contentType, "text/plain");
  EXPECT_EQ(fields.tags, (std::vector<std::string>{"red", "work"}));
  EXPECT_EQ(fields.favoriteRank, 3);
  EXPECT_EQ(fields.flags, 4U | 32U);
  EXPECT_FALSE(fields.capabilities & NSFileProviderItemCapabilitiesAllowsWriting);
  EXPECT_TRUE(fields.capabilities & NSFileProviderItemCapabilitiesAllowsRenaming);
}

}  // namespace
}  // namespace yomber
