#include "yomber/thumbnail_files.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>

#include "platform/foundation/temporary_directory.h"

namespace yomber {
namespace {

const std::string kPNG = "\x89PNG\r\n\x1a\nrest";
const std::string kJPEG = "\xff\xd8\xff\xe0rest";

class ThumbnailFilesTest : public testing::Test {
 protected:
  /// The new file's name.
  std::string write(const std::string& itemName, const std::string& picture) {
    std::string path;
    EXPECT_EQ(files.write(itemName, picture, path), nullptr);
    std::ifstream file(path);
    EXPECT_EQ(std::string(std::istreambuf_iterator<char>(file), {}), picture);
    EXPECT_TRUE(path.starts_with(folder + "/"));
    return path.substr(folder.size() + 1);
  }

  TemporaryDirectory directory;
  const std::string folder = directory / "a/b";
  ThumbnailFiles files{folder};
};

TEST_F(ThumbnailFilesTest, TheFolderIsMadeAndFilesAreNamedAfterTheirItemsAndKinds) {
  ASSERT_EQ(files.open(), nullptr);
  ASSERT_EQ(files.open(), nullptr);
  EXPECT_EQ(write("photo.cr2", kJPEG), "photo.cr2.jpg");
  EXPECT_EQ(write("photo.png", kPNG), "photo.png");
  EXPECT_EQ(write("photo.png", kJPEG), "photo.png.jpg");
  EXPECT_EQ(write("photo", "RIFF1234WEBP"), "photo.webp");
  EXPECT_EQ(write("odd", "what is this"), "odd.img");
  EXPECT_EQ(write("empty", ""), "empty.img");
}

TEST_F(ThumbnailFilesTest, NothingIsReplaced) {
  ASSERT_EQ(files.open(), nullptr);
  EXPECT_EQ(write("photo", kPNG), "photo.png");
  EXPECT_EQ(write("photo", kPNG), "photo 2.png");
  EXPECT_EQ(write("photo", kPNG), "photo 3.png");
}

TEST_F(ThumbnailFilesTest, NumbersGoOnWhereTheyWereAlsoBesideFilesOfOthers) {
  ASSERT_EQ(files.open(), nullptr);
  std::ofstream(folder + "/photo 2.png") << "another's";
  EXPECT_EQ(write("photo", kPNG), "photo.png");
  EXPECT_EQ(write("photo", kPNG), "photo 3.png");
  std::filesystem::remove(folder + "/photo 2.png");
  EXPECT_EQ(write("photo", kPNG), "photo 4.png");
  EXPECT_EQ(write("other", kPNG), "other.png");
}

TEST_F(ThumbnailFilesTest, NoNameLeadsOutOfTheFolder) {
  ASSERT_EQ(files.open(), nullptr);
  EXPECT_EQ(write("../up", kPNG), "_.._up.png");
  EXPECT_EQ(write("/etc/passwd", kPNG), "_etc_passwd.png");
  EXPECT_EQ(write(".hidden", kPNG), "_.hidden.png");
  EXPECT_EQ(write("", kPNG), "item.png");
  EXPECT_EQ(write(std::string("a\0b", 3), kPNG), "a_b.png");
  EXPECT_LE(write(std::string(400, 'x'), kPNG).size(), 255U);
}

TEST_F(ThumbnailFilesTest, AFolderThatCannotBeMadeOrWrittenToIsSaid) {
  std::ofstream(directory / "a") << "in the way";
  EXPECT_NE(files.open(), nullptr);
  std::string path;
  EXPECT_NE(files.write("photo", kPNG, path), nullptr);
}

}  // namespace
}  // namespace yomber
