#include "zarn/name_collation.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <vector>

namespace yomber {
namespace {

std::vector<std::string> sorted(std::vector<std::string> names) {
  std::sort(names.begin(), names.end(), [](const std::string& left, const std::string& right) {
    return nameSortKey(left) < nameSortKey(right);
  });
  return names;
}

TEST(NameCollation, SortsNumbersByValueAndLettersWithoutRegardToCaseFirst) {
  EXPECT_EQ(sorted({"file 10", "file 9", "file 1"}),
            (std::vector<std::string>{"file 1", "file 9", "file 10"}));
  EXPECT_EQ(sorted({"b", "C", "a", "B"}), (std::vector<std::string>{"a", "b", "B", "C"}));
  EXPECT_EQ(sorted({"zebra", "école", "eclair", "fox"}),
            (std::vector<std::string>{"eclair", "école", "fox", "zebra"}));
}

TEST(NameCollation, BreaksTiesByBytes) {
  // Equal under the collation: a control character is ignored by it.
  const std::string plain = "a";
  const std::string controlled = "a\x01";
  EXPECT_EQ(sortKeyCollationPart(nameSortKey(plain)),
            sortKeyCollationPart(nameSortKey(controlled)));
  EXPECT_LT(nameSortKey(plain), nameSortKey(controlled));
}

TEST(NameCollation, AcceptsWhatIsNoUtf8) {
  const std::string first = "bad\xff";
  const std::string second = "bad\xfe";
  EXPECT_NE(nameSortKey(first), nameSortKey(second));
  EXPECT_EQ(sortKeyCollationPart(nameSortKey(first)), sortKeyCollationPart(nameSortKey(second)));
  EXPECT_FALSE(nameSortKey(std::string(255, '\xff')).empty());
  EXPECT_FALSE(nameSortKey("").empty());
}

TEST(NameCollation, HoldsTheNameBehindTheFirstZeroByte) {
  for (const std::string name : {"report.pdf", "Größe 12", "日本語", "a\nb", "\xc3("}) {
    const std::string key = nameSortKey(name);
    EXPECT_EQ(key.substr(key.find('\0') + 1), name);
  }
}

TEST(NameCollation, KnowsNormalizationTwins) {
  const std::string composed = "caf\u00e9";
  const std::string decomposed = "cafe\u0301";
  EXPECT_TRUE(areNormalizationTwins(composed, decomposed));
  EXPECT_EQ(sortKeyCollationPart(nameSortKey(composed)),
            sortKeyCollationPart(nameSortKey(decomposed)));
  EXPECT_FALSE(areNormalizationTwins("cafe", composed));
  EXPECT_FALSE(areNormalizationTwins("a", "a\x01"));
  EXPECT_FALSE(areNormalizationTwins("bad\xff", "bad\xfe"));
  EXPECT_TRUE(areNormalizationTwins("bad\xff", "bad\xff"));
}

}  // namespace
}  // namespace yomber
