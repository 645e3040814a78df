#include "zarn/content_engine.h"

#include "zarn/content/test_content.h"

namespace yomber {
namespace {

class ContentEngineTest : public ContentDrive {};

TEST_F(ContentEngineTest, ANewDocumentIsUploadedAndConfirmed) {
  const std::string text = content(100'000);
  write("a.txt", text);
  settle();
  EXPECT_EQ(state("a.txt").upload, ContentState::Upload::Confirmed);
  EXPECT_EQ(nameInStore(id("a.txt")), "a.txt");
  EXPECT_EQ(contentInStore(id("a.txt")), text);
  EXPECT_NE(row("a.txt")->flags & row_flag::kUploaded, 0U);
}

TEST_F(ContentEngineTest, WhatIsEvictedKeepsItsLooksAndComesBackWhole) {
  const std::string text = content(3'000'000);
  write("a.bin", text);
  ASSERT_EQ(chmod(at("a.bin").c_str(), 0640), 0);
  setAttribute("a.bin", kTagsAttribute, "red,work");
  settle();
  const struct stat before = status("a.bin");
  const NSErrorRef error = evict("a.bin");
  ASSERT_EQ(error, nullptr) << error->description();
  const struct stat away = status("a.bin");
  EXPECT_TRUE(isFault("a.bin"));
  EXPECT_LE(away.st_blocks * 512, 8192);
  EXPECT_EQ(away.st_size, before.st_size);
  EXPECT_EQ(away.st_ino, before.st_ino);
  EXPECT_EQ(away.st_mode, before.st_mode);
  EXPECT_EQ(away.st_mtim.tv_nsec, before.st_mtim.tv_nsec);
  EXPECT_EQ(away.st_mtim.tv_sec, before.st_mtim.tv_sec);
  EXPECT_EQ(read("a.bin").substr(0, 4096), text.substr(0, 4096));
  EXPECT_EQ(row("a.bin")->flags & row_flag::kDownloaded, 0U);

  ASSERT_EQ(provide("a.bin"), nullptr);
  EXPECT_FALSE(isFault("a.bin"));
  EXPECT_EQ(read("a.bin"), text);
  const struct stat back = status("a.bin");
  EXPECT_EQ(back.st_ino, before.st_ino);
  EXPECT_EQ(back.st_mtim.tv_nsec, before.st_mtim.tv_nsec);
  EXPECT_NE(row("a.bin")->flags & row_flag::kDownloaded, 0U);
  EXPECT_EQ(readItemAttributes(at("a.bin").c_str()).extra.tags,
            (std::vector<std::string>{"red", "work"}));
  EXPECT_TRUE(waitUntil([&] {
    return lgetxattr(at("a.bin").c_str(), kFaultAttribute, nullptr, 0) < 0;
  })) << "the marks are taken off once the content is on the disk";
}

}  // namespace
}  // namespace yomber
