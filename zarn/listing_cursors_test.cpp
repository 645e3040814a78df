#include "zarn/listing_cursors.h"

#include <gtest/gtest.h>

namespace yomber {
namespace {

ListingPoint pointAt(const std::string& key) { return {0, key, 0}; }

TEST(ListingCursors, KeepsTheMostRecentlyUsed) {
  ListingCursors cursors(2);
  const ListingScope scope{5000, ListingOrder::Name};
  cursors.store({1, scope, 200}, pointAt("a"));
  cursors.store({1, scope, 400}, pointAt("b"));
  EXPECT_TRUE(cursors.find({1, scope, 200}));
  cursors.store({1, scope, 600}, pointAt("c"));
  EXPECT_EQ(cursors.size(), 2U);
  EXPECT_FALSE(cursors.find({1, scope, 400}));
  EXPECT_EQ(cursors.find({1, scope, 200})->nameKey, "a");
}

TEST(ListingCursors, TellsConnectionsFoldersAndOrdersApart) {
  ListingCursors cursors(10);
  cursors.store({1, {5000, ListingOrder::Name}, 200}, pointAt("a"));
  EXPECT_FALSE(cursors.find({2, {5000, ListingOrder::Name}, 200}));
  EXPECT_FALSE(cursors.find({1, {5001, ListingOrder::Name}, 200}));
  EXPECT_FALSE(cursors.find({1, {5000, ListingOrder::Date}, 200}));
  cursors.removeConnection(2);
  EXPECT_TRUE(cursors.find({1, {5000, ListingOrder::Name}, 200}));
  cursors.removeConnection(1);
  EXPECT_EQ(cursors.size(), 0U);
}

std::shared_ptr<const ListingFences> fencesWith(std::size_t points) {
  auto fences = std::make_shared<ListingFences>();
  fences->points.resize(points);
  return fences;
}

TEST(ListingFenceCache, ForgetsAFolderThatChangedAlsoWhileItWasRead) {
  ListingFenceCache cache(10, 1000);
  const ListingScope scope{5000, ListingOrder::Date};
  cache.beginBuilding(scope);
  cache.store(scope, fencesWith(3));
  EXPECT_TRUE(cache.find(scope));
  cache.invalidateFolder(5001);
  EXPECT_TRUE(cache.find(scope));
  cache.invalidateFolder(5000);
  EXPECT_FALSE(cache.find(scope));
  cache.beginBuilding(scope);
  cache.invalidateFolder(5000);
  cache.store(scope, fencesWith(3));
  EXPECT_FALSE(cache.find(scope));
}

TEST(ListingFenceCache, IsBoundedByListingsAndPoints) {
  ListingFenceCache cache(2, 100);
  for (std::uint64_t folder = 1; folder <= 3; ++folder) {
    const ListingScope scope{folder, ListingOrder::Name};
    cache.beginBuilding(scope);
    cache.store(scope, fencesWith(10));
  }
  EXPECT_FALSE(cache.find({1, ListingOrder::Name}));
  EXPECT_TRUE(cache.find({3, ListingOrder::Name}));
  cache.beginBuilding({9, ListingOrder::Name});
  cache.store({9, ListingOrder::Name}, fencesWith(95));
  EXPECT_TRUE(cache.find({9, ListingOrder::Name}));
  EXPECT_FALSE(cache.find({3, ListingOrder::Name}));
}

}  // namespace
}  // namespace yomber
