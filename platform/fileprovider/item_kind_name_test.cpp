#include "platform/fileprovider/item_kind_name.h"

#include <gtest/gtest.h>

#include <set>
#include <string>

namespace yomber {
namespace {

TEST(ItemKindName, EachKindHasANameOfItsOwn) {
  std::set<std::string> names;
  for (const ItemKind kind : {ItemKind::Document, ItemKind::Folder, ItemKind::Alias,
                              ItemKind::Bookmark, ItemKind::Symlink}) {
    names.insert(itemKindName(kind));
  }
  // Stored in the trash, and read by scripts: they stay as they are.
  EXPECT_EQ(names, (std::set<std::string>{"alias", "bookmark", "document", "folder", "symlink"}));
}

TEST(ItemKindName, WhatIsNoKindIsCalledADocument) {
  EXPECT_STREQ(itemKindName(static_cast<ItemKind>(99)), "document");
}

}  // namespace
}  // namespace yomber
