#include "zarn/listing_cursors.h"

#include <gtest/gtest.h>

namespace yomber {
namespace {

ListingPoint pointAt(const std::string& key) { return {0, key, 0}; }

constexpr ListingScope kByName{5000, ListingOrder::Name};
constexpr ListingCursors::TimePoint kStart{};

std::string taken(ListingCursors& cursors, const ListingCursors::Key& key) {
  const auto point = cursors.take(key);
  return point ? point->nameKey : "nothing";
}

TEST(ListingCursors, KeepsTheMostRecentlyUsed) {
  ListingCursors cursors(2);
  cursors.store({1, kByName, 200}, pointAt("a"), kStart);
  cursors.store({1, kByName, 400}, pointAt("b"), kStart);
  EXPECT_TRUE(cursors.take({1, kByName, 200}));
  cursors.store({1, kByName, 600}, pointAt("c"), kStart);
  EXPECT_EQ(cursors.size(), 2U);
  EXPECT_FALSE(cursors.take({1, kByName, 400}));
  EXPECT_EQ(taken(cursors, {1, kByName, 200}), "a") << "who asks again goes on there again";
}

TEST(ListingCursors, TellsConnectionsFoldersAndOrdersApart) {
  ListingCursors cursors(10);
  cursors.store({1, {5000, ListingOrder::Name}, 200}, pointAt("a"), kStart);
  EXPECT_FALSE(cursors.take({2, {5000, ListingOrder::Name}, 200}));
  EXPECT_FALSE(cursors.take({1, {5001, ListingOrder::Name}, 200}));
  EXPECT_FALSE(cursors.take({1, {5000, ListingOrder::Date}, 200}));
  cursors.removeConnection(2);
  EXPECT_TRUE(cursors.take({1, {5000, ListingOrder::Name}, 200}));
  cursors.removeConnection(1);
  EXPECT_EQ(cursors.size(), 0U);
}

TEST(ListingCursors, WhoeverGoesOnFirstLeavesNothingOutForTheOthers) {
  ListingCursors cursors(10);
  const ListingCursors::Key key{1, kByName, 200};
  for (const char* end : {"199", "299", "249"}) cursors.store(key, pointAt(end), kStart);
  for (int listing = 0; listing < 3; ++listing) EXPECT_EQ(taken(cursors, key), "199");
  cursors.store(key, pointAt("399"), kStart);
  EXPECT_EQ(taken(cursors, key), "399") << "all have gone on: a new listing repeats nothing";
}

TEST(ListingCursors, TheEarlierPointIsTheNewerOneByDate) {
  ListingCursors cursors(10);
  const ListingCursors::Key key{1, {5000, ListingOrder::Date}, 200};
  cursors.store(key, {-50, "a", 0}, kStart);
  cursors.store(key, {-70, "b", 0}, kStart);
  EXPECT_EQ(taken(cursors, key), "b");
}

TEST(ListingCursors, AListingThatNobodyGoesOnWithMakesWay) {
  ListingCursors cursors(10);
  const ListingCursors::Key key{1, kByName, 200};
  cursors.store(key, pointAt("199"), kStart);
  const auto later = kStart + ListingCursors::kPatience;
  cursors.store(key, pointAt("299"), later);
  EXPECT_EQ(cursors.size(), 2U) << "it may come still";
  cursors.store(key, pointAt("399"), later + std::chrono::seconds(1));
  EXPECT_EQ(taken(cursors, key), "299");
}

TEST(ListingCursors, PagesThatNobodyGoesOnFromAreBounded) {
  ListingCursors cursors(1000);
  const ListingCursors::Key key{1, kByName, 200};
  for (int i = 500; i > 0; --i) cursors.store(key, pointAt(std::to_string(100 + i)), kStart);
  EXPECT_EQ(cursors.size(), ListingCursors::kMaximumPerKey);
  EXPECT_EQ(taken(cursors, key), "101");
}

std::shared_ptr<const ListingFences> fencesWith(std::size_t points) {
  auto fences = std::make_shared<ListingFences>();
  fences->points.resize(points);
  return fences;
}

TEST(ListingFenceCache, ForgetsAFolderThatChangedAlsoWhileItWasRead) {
  ListingFenceCache cache(10, 1000);
  const ListingScope scope{5000, ListingOrder::Date};
  cache.store(cache.beginBuilding(scope), fencesWith(3));
  EXPECT_TRUE(cache.find(scope));
  cache.invalidateFolder(5001);
  EXPECT_TRUE(cache.find(scope));
  cache.invalidateFolder(5000);
  EXPECT_FALSE(cache.find(scope));
  const std::uint64_t building = cache.beginBuilding(scope);
  cache.invalidateFolder(5000);
  cache.store(building, fencesWith(3));
  EXPECT_FALSE(cache.find(scope));
}

TEST(ListingFenceCache, OfTwoWhoBuildTheSameEachAnswersForWhatItRead) {
  ListingFenceCache cache(10, 1000);
  const ListingScope scope{5000, ListingOrder::Name};
  const std::uint64_t before = cache.beginBuilding(scope);
  cache.invalidateFolder(5000);
  const std::uint64_t after = cache.beginBuilding(scope);
  cache.store(after, fencesWith(7));
  cache.store(before, fencesWith(3));
  const auto fences = cache.find(scope);
  ASSERT_TRUE(fences);
  EXPECT_EQ(fences->points.size(), 7U);
}

TEST(ListingFenceCache, IsBoundedByListingsAndPoints) {
  ListingFenceCache cache(2, 100);
  for (std::uint64_t folder = 1; folder <= 3; ++folder) {
    const ListingScope scope{folder, ListingOrder::Name};
    cache.store(cache.beginBuilding(scope), fencesWith(10));
  }
  EXPECT_FALSE(cache.find({1, ListingOrder::Name}));
  EXPECT_TRUE(cache.find({3, ListingOrder::Name}));
  cache.store(cache.beginBuilding({9, ListingOrder::Name}), fencesWith(95));
  EXPECT_TRUE(cache.find({9, ListingOrder::Name}));
  EXPECT_FALSE(cache.find({3, ListingOrder::Name}));
}

}  // namespace
}  // namespace yomber
