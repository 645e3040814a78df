#include "platform/foundation/bounced_name.h"

#include <gtest/gtest.h>

#include <set>

namespace yomber {
namespace {

std::string bounced(const std::string& name, const std::set<std::string>& taken) {
  return bouncedName(name, [&](const std::string& candidate) { return taken.contains(candidate); });
}

TEST(BouncedName, KeepsAFreeName) { EXPECT_EQ(bounced("a.txt", {"b.txt"}), "a.txt"); }

TEST(BouncedName, CountsBeforeTheExtension) {
  EXPECT_EQ(bounced("report.pdf", {"report.pdf"}), "report 2.pdf");
  EXPECT_EQ(bounced("report.pdf", {"report.pdf", "report 2.pdf"}), "report 3.pdf");
  EXPECT_EQ(bounced("folder", {"folder"}), "folder 2");
  EXPECT_EQ(bounced(".profile", {".profile"}), ".profile 2");
  EXPECT_EQ(bounced("v1. draft", {"v1. draft"}), "v1. draft 2");
}

TEST(BouncedName, CutsLongStemsBetweenCharacters) {
  std::string name;
  while (name.size() + 2 <= kMaximumNameLength - 4) name += "\u00e9";
  name += ".txt";
  const std::string result = bounced(name, {name});
  EXPECT_LE(result.size(), kMaximumNameLength);
  EXPECT_TRUE(result.ends_with("\u00e9 2.txt")) << result;
}

TEST(BouncedName, KeepsToAShorterLength) {
  const auto isFree = [](const std::string&) { return false; };
  EXPECT_EQ(bouncedName("abcdefgh.txt", isFree, 10), "abcdef.txt");
  EXPECT_EQ(bouncedName("ab\u00e9cdefgh.txt", isFree, 7), "ab.txt");
  EXPECT_EQ(bouncedName(
                "abcdefgh.txt", [](const auto& name) { return name == "abcdef.txt"; }, 10),
            "abcd 2.txt");
  EXPECT_EQ(bouncedName("ab.txt", isFree, 10), "ab.txt");
}

}  // namespace
}  // namespace yomber
