#include "platform/foundation/tree_faults.h"

#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <string>

#include <gtest/gtest.h>

#include "platform/foundation/fault_attributes.h"
#include "platform/foundation/temporary_directory.h"

namespace yomber {
namespace {

class TreeFaultsTest : public ::testing::Test {
 protected:
  TreeFaultsTest() { std::filesystem::create_directories(directory_ / "a/b/c"); }
  void write(const std::string& name, bool isAway) const {
    const std::string path = directory_ / name;
    std::ofstream(path) << "text";
    if (!isAway) return;
    ASSERT_EQ(setxattr(path.c_str(), kFaultAttribute, "1", 1, 0), 0);
  }
  [[nodiscard]] bool holds(const std::string& name) const { return holdsFault(directory_ / name); }

  const TemporaryDirectory directory_;
};

TEST_F(TreeFaultsTest, AFileIsOneOrNot) {
  write("here", false);
  write("away", true);
  EXPECT_FALSE(holds("here"));
  EXPECT_TRUE(holds("away"));
  EXPECT_FALSE(holds("none"));
}

TEST_F(TreeFaultsTest, AFolderHoldsWhatIsAnywhereBelowIt) {
  write("a/b/here", false);
  EXPECT_FALSE(holds("a"));
  write("a/b/c/away", true);
  EXPECT_TRUE(holds("a"));
}

TEST_F(TreeFaultsTest, WhatWasFilledInThisBootIsHere) {
  write("a/b/filled", true);
  const std::string& boot = bootIdentifier();
  const std::string path = directory_ / "a/b/filled";
  ASSERT_EQ(setxattr(path.c_str(), kFilledAttribute, boot.data(), boot.size(), 0), 0);
  EXPECT_FALSE(holds("a"));
}

TEST_F(TreeFaultsTest, LinksAreNotFollowed) {
  write("away", true);
  ASSERT_EQ(symlink((directory_ / "away").c_str(), (directory_ / "a/link").c_str()), 0);
  EXPECT_FALSE(holds("a"));
}

TEST_F(TreeFaultsTest, WhatCannotBeLookedAtCounts) {
  constexpr uid_t kNobody = 65534;
  ASSERT_EQ(chmod(directory_.path().c_str(), 0755), 0);
  ASSERT_EQ(chmod((directory_ / "a/b").c_str(), 0), 0);
  const uid_t user = geteuid();
  ASSERT_TRUE(user != 0 || seteuid(kNobody) == 0);
  EXPECT_TRUE(holds("a"));
  ASSERT_EQ(seteuid(user), 0);
  ASSERT_EQ(chmod((directory_ / "a/b").c_str(), 0700), 0);
}

}  // namespace
}  // namespace yomber
