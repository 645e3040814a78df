#include <gtest/gtest.h>

#include <chrono>

#include "zarn/recent_backups.h"
#include "zarn/test_drive.h"
#include "zarn/write_transaction.h"

namespace yomber {
namespace {

/// What editors do when they save, seen by a scan after each step (or after all of them).
class SafeSavesTest : public TestDrive {
 protected:
  void useClock() {
    database->recentBackups().setClock([this] { return now_; });
  }
  void markUploaded(const std::string& name) {
    const NSErrorRef error = database->write([&](WriteTransaction& transaction) -> NSErrorRef {
      const ItemRow before = *row(name);
      ItemRow uploaded = before;
      uploaded.flags |= row_flag::kUploaded;
      (void)transaction.update(before, uploaded);
      return nullptr;
    });
    ASSERT_EQ(error, nullptr);
  }
  std::chrono::steady_clock::time_point now_{std::chrono::hours(1)};
};

TEST_F(SafeSavesTest, AFileRenamedToABackupAndWrittenAnewKeepsItsIDWhereItsNameIs) {
  for (const bool isSeenAtEachStep : {false, true}) {
    const std::string name = isSeenAtEachStep ? "seen.txt" : "unseen.txt";
    write(name, "first");
    scan();
    const std::uint64_t document = id(name);
    rename(name, name + "~");
    if (isSeenAtEachStep) scan();
    write(name, "second");
    scan();
    EXPECT_EQ(id(name), document);
    EXPECT_NE(id(name + "~"), document);
    EXPECT_NE(id(name + "~"), 0U);
    remove(name + "~");
    scan();
    EXPECT_EQ(id(name), document);
    EXPECT_EQ(idOnDisk(name), document);
  }
}

TEST_F(SafeSavesTest, ABackupThatIsRemovedAtOnceLeavesTheID) {
  write("a.txt", "first");
  scan();
  const std::uint64_t document = id("a.txt");
  rename("a.txt", "a.txt~");
  write("a.txt", "second");
  remove("a.txt~");
  scan();
  EXPECT_EQ(id("a.txt"), document);
}

TEST_F(SafeSavesTest, ABackupThatIsSeenToGoBeforeTheNewFileIsSeenLeavesTheID) {
  for (const bool isUploadedMeanwhile : {false, true}) {
    const std::string name = isUploadedMeanwhile ? "b.txt" : "a.txt";
    write(name, "first");
    scan();
    const std::uint64_t document = id(name);
    rename(name, name + "~");
    scan();
    if (isUploadedMeanwhile) {
      write("new.txt", "second");
      scan();
      markUploaded("new.txt");
    }
    remove(name + "~");
    scan();
    ASSERT_EQ(id(name + "~"), 0U);
    if (isUploadedMeanwhile) {
      rename("new.txt", name);
    } else {
      write(name, "second");
    }
    scan();
    EXPECT_EQ(id(name), document) << name;
    EXPECT_EQ(idOnDisk(name), document) << name;
  }
}

TEST_F(SafeSavesTest, AfterTwoSecondsTheIDStaysWithTheFile) {
  useClock();
  for (const bool isLate : {false, true}) {
    const std::string name = isLate ? "late" : "soon";
    write(name, "first");
    scan();
    const std::uint64_t document = id(name);
    rename(name, name + ".bak");
    scan();
    now_ += std::chrono::milliseconds(isLate ? 2001 : 1999);
    write(name, "second");
    scan();
    EXPECT_EQ(id(isLate ? name + ".bak" : name), document) << name;
    EXPECT_NE(id(isLate ? name : name + ".bak"), document) << name;
  }
}

TEST_F(SafeSavesTest, AFileRenamedToAnotherNameTakesItsIDAlong) {
  write("a.txt", "first");
  scan();
  const std::uint64_t document = id("a.txt");
  rename("a.txt", "b.txt");
  scan();
  write("a.txt", "second");
  scan();
  EXPECT_EQ(id("b.txt"), document);
  EXPECT_NE(id("a.txt"), document);
}

TEST_F(SafeSavesTest, ANewFileRenamedOverADocumentTakesItsID) {
  for (const bool isSeenAtEachStep : {false, true}) {
    write("a.txt", "first");
    scan();
    const std::uint64_t document = id("a.txt");
    write("new.txt", "second");
    if (isSeenAtEachStep) scan();
    rename("new.txt", "a.txt");
    scan();
    EXPECT_EQ(id("a.txt"), document);
    EXPECT_EQ(names(), std::vector<std::string>{"a.txt"});
  }
}

TEST_F(SafeSavesTest, ANewFileThatWasUploadedBeforeItWasRenamedOverADocumentTakesItsID) {
  for (const bool hasBackup : {false, true}) {
    const std::string name = hasBackup ? "b.txt" : "a.txt";
    write(name, "first");
    scan();
    const std::uint64_t document = id(name);
    write("new.txt", "second");
    scan();
    markUploaded("new.txt");
    if (hasBackup) rename(name, name + "~");
    rename("new.txt", name);
    scan();
    EXPECT_EQ(id(name), document) << name;
    EXPECT_EQ(id("new.txt"), 0U);
  }
}

TEST_F(SafeSavesTest, AnUploadedDocumentOfAnotherFolderThatIsMovedOverOneKeepsItsID) {
  makeFolder("folder");
  write("folder/mine.txt", "mine");
  write("a.txt", "first");
  scan();
  const std::uint64_t mine = id("folder/mine.txt");
  markUploaded("folder/mine.txt");
  rename("folder/mine.txt", "a.txt");
  scan();
  EXPECT_EQ(id("a.txt"), mine);
}

TEST(BackupNamesTest, AreToldFromOtherNames) {
  for (const char* backup : {"a.txt~", "a.txt.bak", ".a.txt.bak", "a.bak", "a.txt.orig", "#a.txt#",
                             ".a.txt~", "a.old"}) {
    EXPECT_TRUE(isBackupName(backup, "a.txt")) << backup;
  }
  for (const char* other : {"a.txt", "b.txt~", "a~", "a.pdf", "", "~", ".bak", "a.txt.pdf"}) {
    EXPECT_FALSE(isBackupName(other, "a.txt")) << other;
  }
}

}  // namespace
}  // namespace yomber
