#include "zarn/pages_ahead.h"

#include <gtest/gtest.h>

#include <thread>

#include "platform/foundation/gate.h"

namespace yomber {
namespace {

constexpr std::uint32_t kLimit = 200;

PagesAhead::Key keyOf(std::uint64_t offset, std::uint64_t connection = 1) {
  return {connection, {.folder = 7, .order = ListingOrder::Date}, offset};
}

/// A page that can be told apart by where the next one begins; `begun` says that it is being read.
PagesAhead::Read pageWith(std::uint64_t nextOffset, Gate& begun) {
  return [nextOffset, &begun] {
    begun.open();
    PagesAhead::Page result;
    result.page.nextOffset = nextOffset;
    return std::optional(result);
  };
}

TEST(PagesAheadTest, APageIsTakenOnce) {
  PagesAhead pages(4);
  Gate begun;
  pages.readAhead(keyOf(200), kLimit, 5, pageWith(400, begun));
  ASSERT_TRUE(begun.wait());
  const auto page = pages.take(keyOf(200), kLimit, 5);
  ASSERT_TRUE(page);
  EXPECT_EQ(page->page.nextOffset, 400U);
  EXPECT_FALSE(pages.take(keyOf(200), kLimit, 5));
}

TEST(PagesAheadTest, WhoAsksForAPageThatIsBeingReadGetsIt) {
  PagesAhead pages(4);
  Gate begun;
  Gate mayEnd;
  pages.readAhead(keyOf(200), kLimit, 5, [&]() -> std::optional<PagesAhead::Page> {
    begun.open();
    (void)mayEnd.wait();
    return PagesAhead::Page{.page = {.rows = {}, .nextOffset = 400}, .end = {}};
  });
  ASSERT_TRUE(begun.wait());
  std::thread opener([&] { mayEnd.open(); });
  const auto page = pages.take(keyOf(200), kLimit, 5);
  opener.join();
  ASSERT_TRUE(page);
  EXPECT_EQ(page->page.nextOffset, 400U);
}

TEST(PagesAheadTest, APageFromBeforeACommitIsNotTaken) {
  PagesAhead pages(4);
  Gate begun;
  pages.readAhead(keyOf(200), kLimit, 5, pageWith(400, begun));
  ASSERT_TRUE(begun.wait());
  EXPECT_FALSE(pages.take(keyOf(200), kLimit, 6));
}

TEST(PagesAheadTest, APageOfAnotherSizeIsNotTaken) {
  PagesAhead pages(4);
  Gate begun;
  pages.readAhead(keyOf(200), kLimit, 5, pageWith(400, begun));
  ASSERT_TRUE(begun.wait());
  EXPECT_FALSE(pages.take(keyOf(200), kLimit + 1, 5));
}

TEST(PagesAheadTest, APageThatCouldNotBeReadIsNoPage) {
  PagesAhead pages(4);
  Gate begun;
  pages.readAhead(keyOf(200), kLimit, 5, [&]() -> std::optional<PagesAhead::Page> {
    begun.open();
    return std::nullopt;
  });
  ASSERT_TRUE(begun.wait());
  EXPECT_FALSE(pages.take(keyOf(200), kLimit, 5));
}

TEST(PagesAheadTest, TheOldestGiveWay) {
  PagesAhead pages(2);
  Gate begun[3];
  for (std::uint64_t i = 0; i < 3; ++i) {
    pages.readAhead(keyOf(200, i), kLimit, 5, pageWith(400, begun[i]));
    ASSERT_TRUE(begun[i].wait());
  }
  EXPECT_FALSE(pages.take(keyOf(200, 0), kLimit, 5));
  EXPECT_TRUE(pages.take(keyOf(200, 1), kLimit, 5));
  EXPECT_TRUE(pages.take(keyOf(200, 2), kLimit, 5));
}

TEST(PagesAheadTest, AConnectionsPagesEndWithIt) {
  PagesAhead pages(4);
  Gate begun[2];
  pages.readAhead(keyOf(200, 1), kLimit, 5, pageWith(400, begun[0]));
  pages.readAhead(keyOf(200, 2), kLimit, 5, pageWith(400, begun[1]));
  ASSERT_TRUE(begun[0].wait());
  ASSERT_TRUE(begun[1].wait());
  pages.removeConnection(1);
  EXPECT_FALSE(pages.take(keyOf(200, 1), kLimit, 5));
  EXPECT_TRUE(pages.take(keyOf(200, 2), kLimit, 5));
}

}  // namespace
}  // namespace yomber
