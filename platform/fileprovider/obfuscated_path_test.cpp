#include <gtest/gtest.h>

#include <algorithm>

#include "platform/fileprovider/file_operations.h"

namespace yomber {
namespace {

TEST(ObfuscatedPath, KeepsTheShapeAndTheExtensionAndNoName) {
  const auto path = fp_obfuscatedPath("/home/secret/Report 7.pdf");
  ASSERT_TRUE(path);
  EXPECT_EQ(std::count(path->begin(), path->end(), '/'), 3);
  EXPECT_TRUE(path->ends_with(".pdf")) << *path;
  for (const char* const name : {"home", "secret", "Report"}) {
    EXPECT_EQ(path->find(name), std::string::npos) << *path;
  }
}

TEST(ObfuscatedPath, GivesEqualNamesEqualTokens) {
  EXPECT_EQ(fp_obfuscatedPath("/a/b/a"), fp_obfuscatedPath("/a/b/a"));
  EXPECT_NE(fp_obfuscatedPath("/a"), fp_obfuscatedPath("/b"));
}

TEST(ObfuscatedPath, HidesWhatOnlyLooksLikeAnExtension) {
  const auto path = fp_obfuscatedPath("/notes.my secret");
  EXPECT_EQ(path->find("secret"), std::string::npos);
  EXPECT_EQ(fp_obfuscatedPath("/.secret")->find("secret"), std::string::npos);
}

TEST(ObfuscatedPath, TakesAnything) {
  EXPECT_EQ(fp_obfuscatedPath(std::nullopt), std::nullopt);
  EXPECT_EQ(fp_obfuscatedPath(""), "");
  EXPECT_EQ(fp_obfuscatedPath("/"), "/");
  EXPECT_TRUE(fp_obfuscatedPath("\xff/\n"));
}

}  // namespace
}  // namespace yomber
