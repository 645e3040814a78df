#include "platform/foundation/key_file.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <string>

#include "platform/foundation/temporary_directory.h"

namespace yomber {
namespace {

TEST(KeyFileTest, KeysBelongToTheirGroup) {
  const KeyFile file("stray=1\n[A]\n# no key\nName = a b \r\nName=later\n\n[B]\nName=c\nSize=48\n");
  EXPECT_EQ(file.value("A", "Name"), "a b");
  EXPECT_EQ(file.value("B", "Name"), "c");
  EXPECT_EQ(file.value("C", "Name"), "");
  EXPECT_EQ(file.value("", "stray"), "");
  EXPECT_TRUE(file.hasGroup("B"));
  EXPECT_FALSE(file.hasGroup("C"));
  EXPECT_EQ(file.number("B", "Size", 7), 48);
  EXPECT_EQ(file.number("A", "Name", 7), 7);
}

TEST(KeyFileTest, AListIsWithoutItsEmptyEntries) {
  const KeyFile file("[A]\nTypes=a; b;;c;\n");
  EXPECT_EQ(file.list("A", "Types", ';'), (std::vector<std::string>{"a", "b", "c"}));
  EXPECT_TRUE(file.list("A", "None", ';').empty());
}

TEST(KeyFileTest, WhatIsNoRegularFileHasNoGroup) {
  const TemporaryDirectory directory;
  ASSERT_EQ(mkfifo((directory / "pipe").c_str(), 0600), 0);
  EXPECT_FALSE(KeyFile::read(directory / "pipe").hasGroup("A"));
  EXPECT_FALSE(KeyFile::read(directory / "missing").hasGroup("A"));
  EXPECT_FALSE(KeyFile::read(directory.path()).hasGroup("A"));
}

}  // namespace
}  // namespace yomber
