#include "platform/glimmet/thumbnail_cache.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>
#include <iterator>

#include "platform/foundation/temporary_directory.h"

namespace yomber {
namespace {

namespace fs = std::filesystem;
using Flavour = ThumbnailCache::Flavour;

std::string contentOf(const std::string& path) {
  std::ifstream file(path, std::ios::binary);
  return {std::istreambuf_iterator<char>(file), {}};
}

class ThumbnailCacheTest : public testing::Test {
 protected:
  TemporaryDirectory directory_;
  const ThumbnailCache cache_{directory_ / "cache/thumbnails"};
  const std::string png_ = contentOf(YOMBER_PICTURES "/quarters.png");
  const ThumbnailCache::File file_{.path = "/home/ann/Drive/a photo.jpg", .mtime = 1234, .size = 7};
};

TEST_F(ThumbnailCacheTest, LocationsAreWrittenAsDesktopsDo) {
  EXPECT_EQ(fileURI("/home/jens/photos/me.png"), "file:///home/jens/photos/me.png");
  EXPECT_EQ(fileURI("/a b/\xc3\xa4#?%;[x]+'~!.jpg"),
            "file:///a%20b/%C3%A4%23%3F%25%3B%5Bx%5D+'~!.jpg");
}

TEST_F(ThumbnailCacheTest, AnEntryIsNamedByTheSumOfItsLocation) {
  // The example that every desktop knows.
  EXPECT_EQ(cache_.entryPath("/home/jens/photos/me.png", Flavour::Normal),
            directory_ / "cache/thumbnails/normal/c6ee772d9e49320e97ec29a7eb5b1697.png");
  EXPECT_NE(cache_.entryPath("/a", Flavour::Double).find("/xx-large/"), std::string::npos);
}

TEST_F(ThumbnailCacheTest, WhatIsStoredIsThereForThatDateAlone) {
  EXPECT_FALSE(cache_.has(file_, Flavour::Large));
  ASSERT_EQ(cache_.store(file_, Flavour::Large, png_), nullptr);
  EXPECT_TRUE(cache_.has(file_, Flavour::Large));
  EXPECT_FALSE(cache_.has(file_, Flavour::Normal));
  ThumbnailCache::File later = file_;
  later.mtime = 1235;
  EXPECT_FALSE(cache_.has(later, Flavour::Large));
  ASSERT_EQ(cache_.store(later, Flavour::Large, png_), nullptr);
  EXPECT_TRUE(cache_.has(later, Flavour::Large));
  EXPECT_FALSE(cache_.has(file_, Flavour::Large));
}

TEST_F(ThumbnailCacheTest, AnEntryIsAWholePictureForItsOwnerAlone) {
  ASSERT_EQ(cache_.store(file_, Flavour::Normal, png_), nullptr);
  const std::string path = cache_.entryPath(file_.path, Flavour::Normal);
  const std::string stored = contentOf(path);
  // What was there is there still, around the texts.
  EXPECT_TRUE(stored.starts_with(png_.substr(0, 33)));
  EXPECT_TRUE(stored.ends_with(png_.substr(33)));
  EXPECT_NE(stored.find(std::string("tEXtThumb::Size\0007", 16)), std::string::npos);
  struct stat status{};
  ASSERT_EQ(stat(path.c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 0777U, 0600U);
  ASSERT_EQ(stat(fs::path(path).parent_path().c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 0777U, 0700U);
  std::size_t count = 0;
  for (const auto& each : fs::directory_iterator(fs::path(path).parent_path())) {
    EXPECT_EQ(each.path(), path);
    ++count;
  }
  EXPECT_EQ(count, 1U) << "nothing is left beside it";
}

TEST_F(ThumbnailCacheTest, RubbishIsNoEntryAndIsNotStored) {
  EXPECT_NE(cache_.store(file_, Flavour::Normal, "no picture"), nullptr);
  const std::string path = cache_.entryPath(file_.path, Flavour::Normal);
  fs::create_directories(fs::path(path).parent_path());
  for (const std::string& rubbish :
       {std::string(), std::string("x"), png_, png_.substr(0, 40),
        png_.substr(0, 33) + std::string("\xff\xff\xff\xfftEXtThumb::URI", 18)}) {
    std::ofstream(path, std::ios::binary) << rubbish;
    EXPECT_FALSE(cache_.has(file_, Flavour::Normal));
  }
}

}  // namespace
}  // namespace yomber
