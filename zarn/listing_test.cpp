#include "zarn/listing.h"

#include <set>

#include "platform/ostrell/constants.h"
#include "zarn/row_queries.h"
#include "zarn/test_drive.h"
#include "zarn/write_transaction.h"

namespace yomber {
namespace {

constexpr std::uint64_t kFolder = 4242;

class ListingTest : public TestDrive {
 protected:
  ListingTest() : listing(std::make_unique<Listing>(database)) {
    inTransaction([](WriteTransaction& transaction) {
      ItemRow folder;
      folder.id = kFolder;
      folder.parent = kRootID;
      folder.kind = ItemKind::Folder;
      folder.name = "folder";
      transaction.insert(folder);
    });
  }

  void inTransaction(const std::function<void(WriteTransaction&)>& work) {
    ASSERT_EQ(database->write([&](WriteTransaction& transaction) -> NSErrorRef {
      work(transaction);
      return nullptr;
    }),
              nullptr);
  }
  static void add(WriteTransaction& transaction, const std::string& name, std::int64_t mtime,
                  ItemKind kind = ItemKind::Document, std::uint64_t parent = kFolder) {
    ItemRow row;
    row.id = transaction.issueID();
    row.parent = parent;
    row.kind = kind;
    row.name = name;
    row.mtime = mtime;
    transaction.insert(row);
  }
  /// "item 0" … in a mixed-up order, with dates that rise by number in groups of three.
  void fill(int count) {
    inTransaction([&](WriteTransaction& transaction) {
      for (int i = 0; i < count; ++i) {
        const int number = static_cast<int>((i * 7919LL) % count);
        add(transaction, "item " + std::to_string(number), number / 3);
      }
    });
  }
  std::vector<std::string> expected(int count, ListingOrder order) {
    std::vector<std::string> names;
    if (order == ListingOrder::Name) {
      for (int i = 0; i < count; ++i) names.push_back("item " + std::to_string(i));
      return names;
    }
    for (int group = (count - 1) / 3; group >= 0; --group) {
      for (int i = group * 3; i < std::min(count, group * 3 + 3); ++i) {
        names.push_back("item " + std::to_string(i));
      }
    }
    return names;
  }
  ListingPage page(ListingOrder order, std::uint64_t offset, std::uint32_t limit,
                   std::uint64_t connection = 1) {
    ListingPage result;
    Listing::ReadAhead readAhead;
    EXPECT_EQ(listing->page(connection, kFolder, order, offset, limit, result, readAhead), nullptr);
    if (readAhead) readAhead();
    return result;
  }
  std::vector<std::string> all(ListingOrder order, std::uint32_t limit) {
    std::vector<std::string> names;
    std::uint64_t offset = 0;
    do {
      const ListingPage current = page(order, offset, limit);
      for (const ItemRow& row : current.rows) names.push_back(row.name);
      EXPECT_TRUE(current.nextOffset == 0 || current.nextOffset == names.size());
      offset = current.nextOffset;
    } while (offset != 0);
    return names;
  }

  std::unique_ptr<Listing> listing;
};

class ListingSizes : public ListingTest, public testing::WithParamInterface<int> {};

TEST_P(ListingSizes, PagesHoldEverythingOnceInOrder) {
  const int count = GetParam();
  if (count > 0) fill(count);
  for (const ListingOrder order : {ListingOrder::Name, ListingOrder::Date}) {
    const auto wanted = count > 0 ? expected(count, order) : std::vector<std::string>();
    EXPECT_EQ(all(order, 200), wanted);
    EXPECT_EQ(all(order, 37), wanted);
  }
}

TEST_P(ListingSizes, AnyOffsetIsFoundWithoutACursor) {
  const int count = GetParam();
  if (count > 0) fill(count);
  for (const ListingOrder order : {ListingOrder::Name, ListingOrder::Date}) {
    const auto wanted = count > 0 ? expected(count, order) : std::vector<std::string>();
    for (const int offset : {0, 1, 150, 199, 200, 201, 399, 400, 555, 999, 1000, 5000}) {
      const ListingPage current = page(order, static_cast<std::uint64_t>(offset), 10, 77);
      listing->connectionEnded(77);
      if (offset >= count) {
        EXPECT_TRUE(current.rows.empty()) << offset;
        EXPECT_EQ(current.nextOffset, 0U);
        continue;
      }
      ASSERT_FALSE(current.rows.empty()) << offset;
      EXPECT_EQ(current.rows.front().name, wanted[static_cast<std::size_t>(offset)]);
    }
  }
}

INSTANTIATE_TEST_SUITE_P(Sizes, ListingSizes, testing::Values(0, 1, 199, 200, 201, 1000));

TEST_F(ListingTest, AChangeBetweenPagesNeitherRepeatsNorLosesWhatStayed) {
  fill(1000);
  std::multiset<std::string> seen;
  std::uint64_t offset = 0;
  int round = 0;
  do {
    const ListingPage current = page(ListingOrder::Name, offset, 100);
    for (const ItemRow& row : current.rows) seen.insert(row.name);
    offset = current.nextOffset;
    inTransaction([&](WriteTransaction& transaction) {
      // Ahead of and behind the listing, and the very last entry of the page.
      if (!current.rows.empty()) transaction.remove(current.rows.back());
      add(transaction, "a new one " + std::to_string(round), 0);
      add(transaction, "z new one " + std::to_string(round), 0);
    });
    ASSERT_LT(++round, 100);
  } while (offset != 0);
  for (int i = 0; i < 1000; ++i) EXPECT_EQ(seen.count("item " + std::to_string(i)), 1U) << i;
  EXPECT_EQ(seen.count("z new one 0"), 1U);
  EXPECT_EQ(seen.count("a new one 0"), 0U);
}

TEST_F(ListingTest, ListingsUnderWayAtOnceLoseNothingThatStayed) {
  for (const bool isOlderFirst : {true, false}) {
    fill(1000);
    struct Progress {
      std::uint64_t offset = 0;
      std::set<std::string> seen;
    };
    const auto goOn = [&](Progress& progress) {
      const ListingPage current = page(ListingOrder::Name, progress.offset, 100);
      for (const ItemRow& row : current.rows) progress.seen.insert(row.name);
      progress.offset = current.nextOffset;
      return current.rows;
    };
    Progress older;
    Progress newer;
    const auto first = goOn(older);
    inTransaction([&](WriteTransaction& transaction) {
      for (const ItemRow& row : first) transaction.remove(row);
    });
    goOn(newer);
    Progress& leading = isOlderFirst ? older : newer;
    Progress& following = isOlderFirst ? newer : older;
    while (leading.offset != 0 || following.offset != 0) {
      if (leading.offset != 0) goOn(leading);
      if (following.offset != 0) goOn(following);
    }
    for (int i = 100; i < 1000; ++i) {
      const std::string name = "item " + std::to_string(i);
      EXPECT_TRUE(older.seen.contains(name)) << name;
      EXPECT_TRUE(newer.seen.contains(name)) << name;
    }
    inTransaction([&](WriteTransaction& transaction) {
      for (const ItemRow& row : page(ListingOrder::Name, 0, 1000).rows) transaction.remove(row);
    });
  }
}

TEST_F(ListingTest, APageThatWasReadAheadShowsWhatChangedSince) {
  fill(1000);
  // From the second page on, the next one is read ahead.
  EXPECT_EQ(page(ListingOrder::Name, 0, 100).nextOffset, 100U);
  const ListingPage second = page(ListingOrder::Name, 100, 100);
  inTransaction([](WriteTransaction& transaction) { add(transaction, "item 200 a", 0); });
  const ListingPage third = page(ListingOrder::Name, second.nextOffset, 100);
  ASSERT_EQ(third.rows.size(), 100U);
  EXPECT_EQ(third.rows[0].name, "item 200");
  EXPECT_EQ(third.rows[1].name, "item 200 a");
}

TEST_F(ListingTest, FromTheSecondPageOnTheNextOneIsReadAhead) {
  fill(350);
  ListingPage current;
  Listing::ReadAhead readAhead;
  for (const std::uint64_t offset : {0U, 100U, 200U, 300U}) {
    ASSERT_EQ(listing->page(1, kFolder, ListingOrder::Date, offset, 100, current, readAhead),
              nullptr);
    const bool isFollowed = offset == 100 || offset == 200;
    EXPECT_EQ(static_cast<bool>(readAhead), isFollowed) << offset;
    ASSERT_EQ(current.contentTypes.size(), current.rows.size());
    for (std::size_t i = 0; i < current.rows.size(); ++i) {
      EXPECT_EQ(*current.contentTypes[i], itemContentType(current.rows[i]));
    }
  }
}

TEST_F(ListingTest, FencesFollowChanges) {
  fill(600);
  EXPECT_EQ(page(ListingOrder::Name, 400, 1, 5).rows.front().name, "item 400");
  inTransaction([](WriteTransaction& transaction) { add(transaction, "aaa", 0); });
  EXPECT_EQ(page(ListingOrder::Name, 400, 1, 6).rows.front().name, "item 399");
}

TEST_F(ListingTest, ManyItemsOfOneDateAreAllListed) {
  inTransaction([](WriteTransaction& transaction) {
    for (int i = 0; i < 450; ++i) add(transaction, "item " + std::to_string(i), 1000);
  });
  const auto names = all(ListingOrder::Date, 200);
  ASSERT_EQ(names.size(), 450U);
  EXPECT_EQ(names.front(), "item 0");
  EXPECT_EQ(names.back(), "item 449");
}

TEST_F(ListingTest, AllFoldersLeavesOutTheTrashAndTheRoot) {
  inTransaction([](WriteTransaction& transaction) {
    ItemRow root;
    root.id = kRootID;
    root.parent = kNoParent;
    root.kind = ItemKind::Folder;
    transaction.insert(root);
    for (int i = 0; i < 300; ++i) {
      add(transaction, "sub " + std::to_string(i), i, ItemKind::Folder);
      add(transaction, "sub " + std::to_string(i), i, ItemKind::Folder, kRootID);
      add(transaction, "doc " + std::to_string(i), i);
    }
    add(transaction, "thrown away", 0, ItemKind::Folder, kTrashID);
  });
  for (const ListingOrder order : {ListingOrder::Name, ListingOrder::Date}) {
    std::set<std::uint64_t> seen;
    std::uint64_t offset = 0;
    Listing::ReadAhead readAhead;
    do {
      ListingPage current;
      ASSERT_EQ(listing->foldersPage(1, order, offset, 200, current, readAhead), nullptr);
      if (readAhead) readAhead();
      for (const ItemRow& row : current.rows) EXPECT_TRUE(seen.insert(row.id).second);
      offset = current.nextOffset;
    } while (offset != 0);
    EXPECT_EQ(seen.size(), 601U);
    ListingPage jumped;
    ASSERT_EQ(listing->foldersPage(2, order, 450, 200, jumped, readAhead), nullptr);
    EXPECT_EQ(jumped.rows.size(), 151U);
  }
}

TEST_F(ListingTest, BringsTagsAndRefusesNoLimit) {
  inTransaction([](WriteTransaction& transaction) {
    ItemRow row;
    row.id = 5555;
    row.parent = kFolder;
    row.name = "tagged";
    ItemExtra extra;
    extra.tags = {"red"};
    row.extra = std::make_shared<const ItemExtra>(extra);
    transaction.insert(row);
  });
  const ListingPage current = page(ListingOrder::Date, 0, 1'000'000);
  ASSERT_EQ(current.rows.size(), 1U);
  ASSERT_TRUE(current.rows[0].extra);
  EXPECT_EQ(current.rows[0].extra->tags, std::vector<std::string>{"red"});
  ListingPage none;
  Listing::ReadAhead nothing;
  const NSErrorRef error = listing->page(1, kFolder, ListingOrder::Name, 0, 0, none, nothing);
  ASSERT_TRUE(error);
  EXPECT_TRUE(error->is(QSOstrellErrorDomain, QSOstrellErrorInvalidParameter));
}

TEST_F(ListingTest, AFolderThatIsGoneHasNoEntries) {
  ListingPage current;
  Listing::ReadAhead nothing;
  EXPECT_EQ(listing->page(1, 987654, ListingOrder::Name, 0, 200, current, nothing), nullptr);
  EXPECT_TRUE(current.rows.empty());
  EXPECT_EQ(current.nextOffset, 0U);
}

}  // namespace
}  // namespace yomber
