#include "zarn/pages_ahead.h"

#include <gtest/gtest.h>

#include <thread>

#include "platform/foundation/gate.h"

namespace yomber {
namespace {

constexpr std::uint32_t kLimit = 200;
const ListingPoint kStart{0, "after this", 0};

PagesAhead::Key keyOf(std::uint64_t offset, std::uint64_t connection = 1) {
  return {connection, {.folder = 7, .order = ListingOrder::Date}, offset};
}

/// A page that can be told apart by where the next one begins.
PagesAhead::Read pageWith(std::uint64_t nextOffset) {
  return [nextOffset] {
    PagesAhead::Page result;
    result.page.nextOffset = nextOffset;
    return std::optional(result);
  };
}

TEST(PagesAheadTest, APageIsTakenOnce) {
  PagesAhead pages(4);
  pages.plan(keyOf(200), kStart, kLimit, 5, pageWith(400))();
  const auto page = pages.take(keyOf(200), kStart, kLimit, 5);
  ASSERT_TRUE(page);
  EXPECT_EQ(page->page.nextOffset, 400U);
  EXPECT_FALSE(pages.take(keyOf(200), kStart, kLimit, 5));
}

TEST(PagesAheadTest, WhoAsksForAPageThatIsBeingReadGetsIt) {
  PagesAhead pages(4);
  Gate begun;
  Gate mayEnd;
  const auto read =
      pages.plan(keyOf(200), kStart, kLimit, 5, [&]() -> std::optional<PagesAhead::Page> {
        begun.open();
        (void)mayEnd.wait();
        return pageWith(400)();
      });
  std::thread reader(read);
  ASSERT_TRUE(begun.wait());
  std::thread opener([&] { mayEnd.open(); });
  const auto page = pages.take(keyOf(200), kStart, kLimit, 5);
  opener.join();
  reader.join();
  ASSERT_TRUE(page);
  EXPECT_EQ(page->page.nextOffset, 400U);
}

TEST(PagesAheadTest, APageThatIsNotYetBeingReadIsLeftToWhoAsksForIt) {
  PagesAhead pages(4);
  bool isRead = false;
  const auto read = pages.plan(keyOf(200), kStart, kLimit, 5, [&] {
    isRead = true;
    return pageWith(400)();
  });
  EXPECT_FALSE(pages.take(keyOf(200), kStart, kLimit, 5));
  read();
  EXPECT_FALSE(isRead);
}

TEST(PagesAheadTest, APageFromBeforeACommitIsNotTaken) {
  PagesAhead pages(4);
  pages.plan(keyOf(200), kStart, kLimit, 5, pageWith(400))();
  EXPECT_FALSE(pages.take(keyOf(200), kStart, kLimit, 6));
}

TEST(PagesAheadTest, APageOfAnotherSizeIsNotTaken) {
  PagesAhead pages(4);
  pages.plan(keyOf(200), kStart, kLimit, 5, pageWith(400))();
  EXPECT_FALSE(pages.take(keyOf(200), kStart, kLimit + 1, 5));
}

TEST(PagesAheadTest, PagesOfListingsThatStandAtDifferentPointsAreToldApart) {
  PagesAhead pages(4);
  const ListingPoint other{0, "after that", 0};
  pages.plan(keyOf(200), kStart, kLimit, 5, pageWith(400))();
  pages.plan(keyOf(200), other, kLimit, 5, pageWith(401))();
  EXPECT_EQ(pages.take(keyOf(200), kStart, kLimit, 5)->page.nextOffset, 400U);
  EXPECT_EQ(pages.take(keyOf(200), other, kLimit, 5)->page.nextOffset, 401U);
}

TEST(PagesAheadTest, APageThatCouldNotBeReadIsNoPage) {
  PagesAhead pages(4);
  pages.plan(keyOf(200), kStart, kLimit, 5,
             []() -> std::optional<PagesAhead::Page> { return std::nullopt; })();
  EXPECT_FALSE(pages.take(keyOf(200), kStart, kLimit, 5));
}

TEST(PagesAheadTest, TheOldestGiveWay) {
  PagesAhead pages(2);
  for (std::uint64_t i = 0; i < 3; ++i) {
    pages.plan(keyOf(200, i), kStart, kLimit, 5, pageWith(400))();
  }
  EXPECT_FALSE(pages.take(keyOf(200, 0), kStart, kLimit, 5));
  EXPECT_TRUE(pages.take(keyOf(200, 1), kStart, kLimit, 5));
  EXPECT_TRUE(pages.take(keyOf(200, 2), kStart, kLimit, 5));
}

TEST(PagesAheadTest, AConnectionsPagesEndWithIt) {
  PagesAhead pages(4);
  pages.plan(keyOf(200, 1), kStart, kLimit, 5, pageWith(400))();
  pages.plan(keyOf(200, 2), kStart, kLimit, 5, pageWith(400))();
  pages.removeConnection(1);
  EXPECT_FALSE(pages.take(keyOf(200, 1), kStart, kLimit, 5));
  EXPECT_TRUE(pages.take(keyOf(200, 2), kStart, kLimit, 5));
}

}  // namespace
}  // namespace yomber
