#include "fileproviderd/container_picture.h"

#include <gtest/gtest.h>

#include <set>

namespace yomber {
namespace {

using Change = ContainerPicture::Change;

ItemFields itemNamed(const std::string& identifier, std::uint64_t rank = 1) {
  ItemFields item;
  item.identifier = identifier;
  item.rank = rank;
  return item;
}

TEST(ContainerPicture, TellsNewFromChangedFromUnchanged) {
  ContainerPicture picture;
  picture.beginListing();
  EXPECT_EQ(picture.didList(itemNamed("a")), Change::New);
  EXPECT_EQ(picture.didUpdate(itemNamed("a", 2)), Change::Unchanged) << "a rank shows nowhere";
  auto renamed = itemNamed("a", 3);
  renamed.filename = "other";
  EXPECT_EQ(picture.didUpdate(renamed), Change::Changed);
  EXPECT_TRUE(picture.didDelete("a"));
  EXPECT_FALSE(picture.didDelete("a"));
}

TEST(ContainerPicture, RanksCountWithinOneListingOnly) {
  ContainerPicture picture;
  picture.beginListing();
  EXPECT_EQ(picture.didList(itemNamed("a", 10)), Change::New);
  auto older = itemNamed("a", 9);
  older.filename = "older";
  EXPECT_EQ(picture.didUpdate(older), Change::Outdated);
  older.rank = 0;
  EXPECT_EQ(picture.didUpdate(older), Change::Changed) << "without a rank nothing is known";
  picture.beginListing();
  EXPECT_EQ(picture.didList(itemNamed("a", 1)), Change::Changed);
}

TEST(ContainerPicture, WhatAListingDoesNotShowIsGone) {
  ContainerPicture picture;
  picture.beginListing();
  for (const char* identifier : {"a", "b", "c"}) (void)picture.didList(itemNamed(identifier));
  EXPECT_TRUE(picture.endListing().empty());
  picture.beginListing();
  (void)picture.didList(itemNamed("b"));
  (void)picture.didUpdate(itemNamed("d"));
  const auto gone = picture.endListing();
  EXPECT_EQ(std::set<std::string>(gone.begin(), gone.end()), (std::set<std::string>{"a", "c"}));
  EXPECT_EQ(picture.size(), 2U);
  EXPECT_EQ(picture.clear().size(), 2U);
  EXPECT_EQ(picture.size(), 0U);
}

TEST(ContainerPicture, TheFingerprintSeesEveryField) {
  const ItemFields base = itemNamed("a");
  std::set<std::uint64_t> prints{itemFingerprint(base)};
  const auto expectNew = [&](const char* field, auto change) {
    ItemFields item = base;
    change(item);
    EXPECT_TRUE(prints.insert(itemFingerprint(item)).second) << field;
  };
  expectNew("parent", [](auto& i) { i.parentIdentifier = "p"; });
  expectNew("filename", [](auto& i) { i.filename = "f"; });
  expectNew("type", [](auto& i) { i.contentType = "t"; });
  expectNew("kind", [](auto& i) { i.kind = ItemKind::Folder; });
  expectNew("rawID", [](auto& i) { i.rawID = 1; });
  expectNew("size", [](auto& i) { i.size = 1; });
  expectNew("created", [](auto& i) { i.creationDate = NSDate::fromNanoseconds(1); });
  expectNew("modified", [](auto& i) { i.modificationDate = NSDate::fromNanoseconds(1); });
  expectNew("used", [](auto& i) { i.lastUsedDate = NSDate(); });
  expectNew("favourite", [](auto& i) { i.favoriteRank = 0; });
  expectNew("tags", [](auto& i) { i.tags = {"x"}; });
  expectNew("tag order", [](auto& i) { i.tags = {"x", "y"}; });
  expectNew("tag order turned", [](auto& i) { i.tags = {"y", "x"}; });
  expectNew("capabilities", [](auto& i) { i.capabilities = 1; });
  expectNew("flags", [](auto& i) { i.flags = 1; });
  expectNew("version", [](auto& i) { i.version = 1; });
  expectNew("children", [](auto& i) { i.childCount = 1; });
  expectNew("container", [](auto& i) { i.containerID = "c"; });
}

}  // namespace
}  // namespace yomber
