#include "zarn/journal_queue.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

namespace yomber {
namespace {

using testing::ElementsAre;
using testing::IsEmpty;

ShownName shown(std::uint64_t folder, const std::string& name, const std::string& shownName) {
  return {.folder = folder, .name = name, .shownName = shownName, .location = {}};
}
ShownName container(std::uint64_t folder, const std::string& location, const std::string& name) {
  return {.folder = folder, .name = {}, .shownName = name, .location = location};
}

TEST(JournalQueueTest, TellsEveryEntryOnceFolderByFolder) {
  JournalQueue queue;
  queue.add(DiskEntry{2, "x"});
  queue.add(DiskEntry{1, "b"});
  queue.add(DiskEntry{2, "x"});
  queue.add(DiskEntry{2, "a"});
  EXPECT_EQ(queue.size(), 3U);
  EXPECT_THAT(queue.take(10).entries,
              ElementsAre(DiskEntry{2, "a"}, DiskEntry{2, "x"}, DiskEntry{1, "b"}));
  EXPECT_EQ(queue.size(), 0U);
  EXPECT_TRUE(queue.take(10).isEmpty());
}

TEST(JournalQueueTest, AWholeFolderStandsForItsEntries) {
  JournalQueue queue;
  queue.add(DiskEntry{1, "a"});
  queue.add(DiskEntry{1, "b"});
  queue.add(DiskEntry{1, ""});
  queue.add(DiskEntry{1, "c"});
  EXPECT_EQ(queue.size(), 1U);
  EXPECT_THAT(queue.take(10).entries, ElementsAre(DiskEntry{1, ""}));
  queue.add(DiskEntry{1, "c"});
  EXPECT_THAT(queue.take(10).entries, ElementsAre(DiskEntry{1, "c"}));
}

TEST(JournalQueueTest, TakesNoMoreThanTheLimitAndGoesOnWhereItStopped) {
  JournalQueue queue;
  queue.add(shown(1, "a", "A"));
  for (const char* name : {"a", "b", "c"}) queue.add(DiskEntry{1, name});
  auto batch = queue.take(2);
  EXPECT_THAT(batch.shownNames, ElementsAre(shown(1, "a", "A")));
  EXPECT_THAT(batch.entries, ElementsAre(DiskEntry{1, "a"}));
  EXPECT_EQ(queue.size(), 2U);
  batch = queue.take(2);
  EXPECT_THAT(batch.entries, ElementsAre(DiskEntry{1, "b"}, DiskEntry{1, "c"}));
}

TEST(JournalQueueTest, OfSeveralNamesForOneEntryTheLastIsTold) {
  JournalQueue queue;
  queue.add(shown(1, "a", ""));
  queue.add(shown(1, "a", "A"));
  EXPECT_EQ(queue.size(), 1U);
  EXPECT_THAT(queue.take(10).shownNames, ElementsAre(shown(1, "a", "A")));
}

TEST(JournalQueueTest, AContainerIsKnownByItsLocation) {
  JournalQueue queue;
  queue.add(container(7, "/tree/a/Documents", ""));
  queue.add(container(5, "/tree/a/Documents", "Notes"));
  queue.add(container(5, "/tree/b/Documents", "Other"));
  EXPECT_THAT(queue.take(10).shownNames, ElementsAre(container(5, "/tree/a/Documents", "Notes"),
                                                     container(5, "/tree/b/Documents", "Other")));
}

TEST(JournalQueueTest, ClearingLeavesNothing) {
  JournalQueue queue;
  queue.add(shown(1, "a", "A"));
  queue.add(DiskEntry{1, "a"});
  queue.clear();
  EXPECT_EQ(queue.size(), 0U);
  EXPECT_TRUE(queue.take(10).isEmpty());
  queue.add(DiskEntry{1, "b"});
  EXPECT_THAT(queue.take(10).entries, ElementsAre(DiskEntry{1, "b"}));
}

}  // namespace
}  // namespace yomber
