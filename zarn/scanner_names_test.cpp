#include <set>

#include "zarn/scanner.h"
#include "zarn/test_drive.h"

namespace yomber {
namespace {

const std::string kComposed = "caf\u00e9.txt";
const std::string kDecomposed = "cafe\u0301.txt";

class ScannerNames : public TestDrive, public testing::WithParamInterface<bool> {
 protected:
  /// Either all at once, or into a drive that is already there.
  void scanAtLast() {
    if (GetParam()) {
      scan();
    } else {
      scan();
      ASSERT_EQ(scanner->scanFolders({kRootID}), nullptr);
    }
  }
  void begin() {
    if (!GetParam()) scan();
  }
};

TEST_P(ScannerNames, KeepsBytesThatAreNoUtf8AndNewlines) {
  begin();
  const std::vector<std::string> odd{"bad\xff\xfe", "bad\xff", "line\nbreak", std::string(255, 'x'),
                                     " ",           "-",       "\xc3",        "tab\t",
                                     "\x01"};
  for (const std::string& name : odd) write(name);
  scanAtLast();
  const auto found = names();
  EXPECT_EQ(std::set<std::string>(found.begin(), found.end()),
            std::set<std::string>(odd.begin(), odd.end()));
  for (const std::string& name : odd) {
    ASSERT_TRUE(row(name)) << name;
    EXPECT_EQ(store->logicalPath(id(name)), at(name));
  }
  EXPECT_EQ(scan().changes, 0U);
}

TEST_P(ScannerNames, OneOfTwoNormalizationTwinsGetsAnotherNameInTheDrive) {
  begin();
  write(kComposed, "composed");
  write(kDecomposed, "decomposed!");
  scanAtLast();
  ASSERT_EQ(store->counts().items, 2U);
  std::set<std::string> driveNames;
  std::set<std::string> diskNames;
  for (const ItemRow& child : store->children(kRootID)) {
    driveNames.insert(child.name);
    diskNames.insert(child.nameOnDisk());
    EXPECT_EQ(child.diskName.empty(), child.name == child.nameOnDisk());
    EXPECT_EQ(store->physicalPath(child.id), at(child.nameOnDisk()));
    EXPECT_EQ(store->logicalPath(child.id), at(child.name));
    EXPECT_EQ(store->itemAtPath(at(child.name))->id, child.id);
  }
  EXPECT_EQ(diskNames, (std::set<std::string>{kComposed, kDecomposed}));
  const bool isBounced =
      driveNames.contains("caf\u00e9 2.txt") || driveNames.contains("cafe\u0301 2.txt");
  EXPECT_TRUE(isBounced);
  EXPECT_EQ(scan().changes, 0U);
  EXPECT_EQ(scanner->scanFolders({kRootID}), nullptr);
  EXPECT_EQ(store->counts().items, 2U);
}

TEST_P(ScannerNames, ABouncedNameYieldsToNoFileOfThatName) {
  begin();
  write(kComposed);
  write(kDecomposed);
  write("caf\u00e9 2.txt");
  write("cafe\u0301 2.txt");
  scanAtLast();
  const auto found = names();
  EXPECT_EQ(found.size(), 4U);
  EXPECT_EQ(std::set<std::string>(found.begin(), found.end()).size(), 4U);
  EXPECT_EQ(scan().changes, 0U);
}

INSTANTIATE_TEST_SUITE_P(FirstScan, ScannerNames, testing::Bool());

class ScannerTwins : public TestDrive {};

TEST_F(ScannerTwins, TheLaterOneIsRenamedAndAForcedScanFindsIt) {
  write(kComposed);
  scan();
  const auto first = id(kComposed);
  write(kDecomposed, "later");
  NSErrorRef error;
  const auto later = scanner->scanLocation(at(kDecomposed), &error);
  ASSERT_TRUE(later) << error->description();
  EXPECT_NE(later->id, first);
  EXPECT_EQ(later->name, "cafe\u0301 2.txt");
  EXPECT_EQ(later->diskName, kDecomposed);
  EXPECT_EQ(id(kComposed), first);
  // By its name in the drive it is found as well, and scanned where it lies.
  write(kDecomposed, "changed now");
  const auto again = scanner->scanLocation(at("cafe\u0301 2.txt"), &error);
  ASSERT_TRUE(again);
  EXPECT_EQ(again->id, later->id);
  EXPECT_EQ(again->size, 11U);
}

TEST_F(ScannerTwins, RenamesKeepTheNamesApart) {
  write(kComposed);
  write("other.txt");
  scan();
  const auto other = id("other.txt");
  rename("other.txt", kDecomposed);
  scan();
  EXPECT_EQ(store->itemByID(other)->name, "cafe\u0301 2.txt");
  rename(kDecomposed, "free.txt");
  scan();
  EXPECT_EQ(store->itemByID(other)->name, "free.txt");
  EXPECT_EQ(store->itemByID(other)->diskName, "");
}

}  // namespace
}  // namespace yomber
