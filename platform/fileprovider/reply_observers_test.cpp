#include "platform/fileprovider/reply_observers.h"

#include <gtest/gtest.h>

#include <optional>

#include "platform/fileprovider/wire_item.h"
#include "platform/foundation/log.h"

namespace yomber {
namespace {

NSFileProviderItemRef itemNamed(const std::string& identifier) {
  ItemFields fields;
  fields.identifier = identifier;
  return std::make_shared<WireItem>(fields);
}

/// Counts the lines of level fault while it lives.
class FaultCounter : public Log::Sink, public std::enable_shared_from_this<FaultCounter> {
 public:
  void write(LogLevel level, std::string_view /*line*/) override {
    if (level == LogLevel::Fault) ++faults;
  }
  int faults = 0;
};

class ReplyObservers : public testing::Test {
 protected:
  ReplyObservers() { defaultLog().setSink(log); }
  ~ReplyObservers() override { defaultLog().setSink(nullptr); }

  std::shared_ptr<PageObserver> pageObserver() {
    return std::make_shared<PageObserver>([this](EnumeratedPage told) {
      ++answers;
      page = std::move(told);
    });
  }
  std::shared_ptr<ChangesObserver> changesObserver() {
    return std::make_shared<ChangesObserver>([this](EnumeratedChanges told) {
      ++answers;
      changes = std::move(told);
    });
  }

  const std::shared_ptr<FaultCounter> log = std::make_shared<FaultCounter>();
  int answers = 0;
  EnumeratedPage page;
  EnumeratedChanges changes;
};

TEST_F(ReplyObservers, CollectItemsUntilThePageIsFinished) {
  const auto observer = pageObserver();
  observer->didEnumerateItems({itemNamed("a"), nullptr});
  observer->didEnumerateItems({itemNamed("b")});
  EXPECT_EQ(answers, 0);
  const auto next = NSData::dataWithString("next");
  observer->finishEnumeratingUpToPage(next);
  ASSERT_EQ(answers, 1);
  ASSERT_EQ(page.items.size(), 2U) << "nil items are left out";
  EXPECT_EQ(page.items[1]->itemIdentifier(), "b");
  EXPECT_EQ(page.next, next);
  EXPECT_EQ(page.error, nullptr);
}

TEST_F(ReplyObservers, IgnoreAndReportASecondFinish) {
  const auto observer = pageObserver();
  observer->finishEnumeratingUpToPage(nullptr);
  observer->didEnumerateItems({itemNamed("late")});
  observer->finishEnumeratingUpToPage(nullptr);
  observer->finishEnumeratingWithError(NSError::errorWithErrno(5));
  EXPECT_EQ(answers, 1);
  EXPECT_EQ(page.error, nullptr);
  EXPECT_EQ(log->faults, 3);
}

TEST_F(ReplyObservers, AnErrorTakesThePlaceOfTheItems) {
  const auto observer = pageObserver();
  observer->didEnumerateItems({itemNamed("a")});
  const auto error = NSError::errorWithErrno(5);
  observer->finishEnumeratingWithError(error);
  EXPECT_EQ(page.error, error);
  EXPECT_TRUE(page.items.empty());
  changesObserver()->finishEnumeratingWithError(nullptr);
  EXPECT_NE(changes.error, nullptr) << "a failure without an error is still one";
}

TEST_F(ReplyObservers, AnObserverLetGoUnfinishedSaysSo) {
  pageObserver()->didEnumerateItems({itemNamed("a")});
  ASSERT_EQ(answers, 1);
  EXPECT_TRUE(page.error->is(NSCocoaErrorDomain, NSXPCConnectionReplyInvalid));
  changesObserver();
  ASSERT_EQ(answers, 2);
  EXPECT_TRUE(changes.error->is(NSCocoaErrorDomain, NSXPCConnectionReplyInvalid));
}

TEST_F(ReplyObservers, CollectChanges) {
  const auto observer = changesObserver();
  observer->didUpdateItems({itemNamed("a")});
  observer->didDeleteItemsWithIdentifiers({"b", "c"});
  observer->didUpdateItems({itemNamed("d")});
  observer->finishEnumeratingChangesUpToSyncAnchor(NSData::dataWithString("anchor"), true);
  ASSERT_EQ(answers, 1);
  EXPECT_EQ(changes.updated.size(), 2U);
  EXPECT_EQ(changes.deleted, (std::vector<std::string>{"b", "c"}));
  EXPECT_EQ(changes.anchor->bytes(), "anchor");
  EXPECT_TRUE(changes.moreComing);
}

TEST_F(ReplyObservers, ChangesWithoutAnAnchorAreAnError) {
  changesObserver()->finishEnumeratingChangesUpToSyncAnchor(nullptr, false);
  EXPECT_NE(changes.error, nullptr);
}

}  // namespace
}  // namespace yomber
