#include "zarn/change_feed.h"

#include <set>

#include "platform/fileprovider/constants.h"
#include "zarn/test_drive.h"
#include "zarn/write_transaction.h"

namespace yomber {
namespace {

class ChangeFeedTest : public TestDrive {
 protected:
  ChangeFeedTest() : feed(database) {
    scan();
    for (const char* name : {"plain", "tagged", "favorite", "shared", "recent", "stale"})
      write(name);
    setAttribute("tagged", kTagsAttribute, "red, work,,red");
    setAttribute("favorite", kFavoriteAttribute, "7");
    setAttribute("shared", kSharedAttribute, "");
    setAttribute("recent", kLastUsedAttribute, std::to_string(now()));
    setAttribute("stale", kLastUsedAttribute,
                 std::to_string(now() - ChangeFeed::kRecentlyUsed - 1));
    EXPECT_EQ(scanner->scanFolders({kRootID}), nullptr);
  }
  static std::int64_t now() { return NSDate::now().nanoseconds(); }

  WorkingSetChanges changes(std::optional<std::string> token, std::uint32_t limit = 1000) {
    WorkingSetChanges result;
    const NSErrorRef error = feed.workingSetChanges(token, limit, result);
    EXPECT_EQ(error, nullptr) << error->description();
    return result;
  }
  static std::set<std::string> names(const WorkingSetChanges& changes) {
    std::set<std::string> result;
    for (const ItemRow& row : changes.updated) result.insert(row.name);
    return result;
  }
  void rescan() { ASSERT_EQ(scanner->scanFolders({kRootID}), nullptr); }

  ChangeFeed feed;
};

TEST_F(ChangeFeedTest, BeginsWithTheMembers) {
  const WorkingSetChanges first = changes(std::nullopt);
  EXPECT_EQ(names(first), (std::set<std::string>{"tagged", "favorite", "shared", "recent"}));
  EXPECT_TRUE(first.departed.empty());
  const auto tagged = row("tagged");
  EXPECT_EQ(tagged->extra->tags, (std::vector<std::string>{"red", "work"}));
  EXPECT_EQ(row("favorite")->extra->favoriteRank, 7);
}

TEST_F(ChangeFeedTest, AnswersTheSameTokenWhenNothingIsLeft) {
  const std::string token = changes(std::nullopt).token;
  const WorkingSetChanges again = changes(token);
  EXPECT_TRUE(again.updated.empty() && again.departed.empty());
  EXPECT_EQ(again.token, token);
  // What is no member's business moves nothing.
  write("another");
  rescan();
  EXPECT_EQ(changes(token).token, token);
}

TEST_F(ChangeFeedTest, PagesCoverEveryMemberOnce) {
  std::multiset<std::string> seen;
  std::optional<std::string> token;
  for (int round = 0; round < 10; ++round) {
    const WorkingSetChanges page = changes(token, 1);
    for (const ItemRow& row : page.updated) seen.insert(row.name);
    if (page.token == token) break;
    token = page.token;
  }
  EXPECT_EQ(seen, (std::multiset<std::string>{"tagged", "favorite", "shared", "recent"}));
}

TEST_F(ChangeFeedTest, TellsChangesAndDepartures) {
  const std::string token = changes(std::nullopt).token;
  write("tagged", "changed");
  const std::uint64_t favorite = id("favorite");
  removeAttribute("favorite", kFavoriteAttribute);
  const std::uint64_t shared = id("shared");
  remove("shared");
  setAttribute("plain", kTagsAttribute, "new");
  rescan();
  const WorkingSetChanges delta = changes(token);
  EXPECT_EQ(names(delta), (std::set<std::string>{"tagged", "plain"}));
  std::set<std::uint64_t> departed;
  for (const DepartedItem& item : delta.departed) departed.insert(item.id);
  EXPECT_EQ(departed, (std::set<std::uint64_t>{favorite, shared}));
  // Who begins now hears of no departures.
  EXPECT_TRUE(changes(std::nullopt).departed.empty());
}

TEST_F(ChangeFeedTest, DeparturesDuringTheFirstListingAreTold) {
  const WorkingSetChanges first = changes(std::nullopt, 1);
  ASSERT_EQ(first.updated.size(), 1U);
  const std::string gone = first.updated[0].name;
  remove(gone);
  rescan();
  const WorkingSetChanges rest = changes(first.token);
  ASSERT_EQ(rest.departed.size(), 1U);
  EXPECT_EQ(rest.departed[0].id, first.updated[0].id);
  EXPECT_EQ(rest.updated.size(), 3U);
}

TEST_F(ChangeFeedTest, TrashedItemsLeaveTheSet) {
  const std::string token = changes(std::nullopt).token;
  const std::uint64_t tagged = id("tagged");
  ASSERT_EQ(::rename(at("tagged").c_str(), (layout.trashFiles() + "/tagged").c_str()), 0);
  ASSERT_EQ(scanner->scanFolders({kRootID, kTrashID}), nullptr);
  const WorkingSetChanges delta = changes(token);
  ASSERT_EQ(delta.departed.size(), 1U);
  EXPECT_EQ(delta.departed[0].id, tagged);
  EXPECT_TRUE(store->itemByID(tagged)->isTrashed());
}

TEST_F(ChangeFeedTest, UsesGoOutOfDate) {
  const std::string token = changes(std::nullopt).token;
  EXPECT_FALSE(feed.expireRecentlyUsed(now()));
  const std::uint64_t recent = id("recent");
  EXPECT_TRUE(feed.expireRecentlyUsed(now() + ChangeFeed::kRecentlyUsed + 1'000'000'000));
  const WorkingSetChanges delta = changes(token);
  ASSERT_EQ(delta.departed.size(), 1U);
  EXPECT_EQ(delta.departed[0].id, recent);
}

TEST_F(ChangeFeedTest, TokensSurviveARestart) {
  const std::string token = changes(std::nullopt).token;
  reopen();
  ChangeFeed after(database);
  WorkingSetChanges result;
  ASSERT_EQ(after.workingSetChanges(token, 100, result), nullptr);
  EXPECT_EQ(result.token, token);
}

TEST_F(ChangeFeedTest, RefusesTokensThatCannotBeAnswered) {
  const std::string token = changes(std::nullopt).token;
  std::string otherDatabase = token;
  otherDatabase[3] = static_cast<char>(otherDatabase[3] ^ 1);
  std::string future = token;
  future[9] = static_cast<char>(future[9] | 0x7f);
  for (const std::string& bad :
       {std::string(), std::string("x"), token.substr(1), token + "x", otherDatabase, future,
        std::string(token.size(), '\xff'), std::string(token.size(), '\0')}) {
    WorkingSetChanges result;
    const NSErrorRef error = feed.workingSetChanges(bad, 100, result);
    ASSERT_NE(error, nullptr);
    EXPECT_TRUE(error->is(NSFileProviderErrorDomain, NSFileProviderErrorSyncAnchorExpired));
  }
}

TEST_F(ChangeFeedTest, RefusesATokenFromBeforeThePruning) {
  const std::string token = changes(std::nullopt).token;
  ASSERT_EQ(database->write([](WriteTransaction& transaction) -> NSErrorRef {
    StatementUse statement(transaction.connection().prepared(
        "WITH RECURSIVE n(i) AS (SELECT 1 UNION ALL SELECT i+1 FROM n WHERE i<?1) "
        "INSERT INTO working(id,rank,kind,member) SELECT i+100000,?2+i,0,0 FROM n"));
    statement->bindInteger(1, kMaximumTombstones);
    statement->bindID(2, transaction.rank());
    statement->step();
    for (std::int64_t i = 0; i < kMaximumTombstones; ++i) transaction.nextRank();
    for (int i = 0; i < 1100; ++i) {
      ItemRow row;
      row.id = transaction.issueID();
      row.parent = kRootID;
      row.name = "item " + std::to_string(i);
      row.flags = row_flag::kShared;
      transaction.insert(row);
      transaction.remove(row);
    }
    return nullptr;
  }),
            nullptr);
  WorkingSetChanges result;
  const NSErrorRef error = feed.workingSetChanges(token, 100, result);
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(NSFileProviderErrorDomain, NSFileProviderErrorSyncAnchorExpired));
  EXPECT_EQ(changes(std::nullopt).updated.size(), 4U);
}

}  // namespace
}  // namespace yomber
