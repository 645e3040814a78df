#include "platform/ostrell/exclusions.h"

#include <gtest/gtest.h>

namespace yomber {
namespace {

TEST(Exclusions, NamesThatNeverSync) {
  for (const char* name :
       {".~lock.report.odt#", "~$report.docx", ".#notes.txt", "#notes.txt#", ".notes.txt.swp",
        ".notes.txt.swo", ".notes.txt.swx", ".goutputstream-AB12CD", ".fuse_hidden0000001200000001",
        ".nfs000000000004c1d300000001", "film.mkv.part", "film.mkv.partial", "film.mkv.crdownload",
        "film.mkv.opdownload", ".notes.txt.kate-swp", "build.nosync", ".nosync", ".DS_Store"}) {
    EXPECT_TRUE(qs_isExcludedName(name)) << name;
  }
}

TEST(Exclusions, NamesThatSync) {
  for (const char* name :
       {"",     "a",       "report.odt", ".hidden",  "notes.swp",    "map.swx",
        "part", "partial", "a.parts",    "nosync",   "a.nosync.txt", "#",
        "##",   "# notes", "#tag",       "~",        "~a",           ".~lock.report.odt",
        ".swp", "4913",    ".lock",      "DS_Store", "file.download"}) {
    EXPECT_FALSE(qs_isExcludedName(name)) << name;
  }
}

TEST(Exclusions, MovesToWhereNothingSyncs) {
  EXPECT_TRUE(qs_isExcludedMove("/d/a", "/d/a.part"));
  EXPECT_TRUE(qs_isExcludedMove("/d/a", "/d/x.nosync/a"));
  EXPECT_TRUE(qs_isExcludedMove("/up.part/d/a", "/up.part/d/a.part"));
  EXPECT_FALSE(qs_isExcludedMove("/d/a", "/d/b"));
  EXPECT_FALSE(qs_isExcludedMove("/up.part/d/a", "/up.part/d/b/a"));
  EXPECT_FALSE(qs_isExcludedMove("/d/a.part", "/d/a"));
  EXPECT_FALSE(qs_isExcludedMove("/d/a.part", "/d/b.part"));
  EXPECT_FALSE(qs_isExcludedMove("", ""));
}

}  // namespace
}  // namespace yomber
