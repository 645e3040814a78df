#include "platform/launchservices/icon_themes.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>

#include "platform/foundation/temporary_directory.h"

namespace yomber {
namespace {

namespace fs = std::filesystem;

class IconThemesTest : public testing::Test {
 protected:
  void SetUp() override {
    write("base/hicolor/index.theme",
          "[Icon Theme]\nName=Hicolor\nDirectories=16x16/apps,48x48/apps,128x128/apps,any/apps\n"
          "ScaledDirectories=48x48@2/apps\n[16x16/apps]\nSize=16\n[48x48/apps]\nSize=48\n"
          "[128x128/apps]\nSize=128\n[48x48@2/apps]\nSize=48\nScale=2\n"
          "[any/apps]\nSize=48\nType=Scalable\n");
    write("base/bright/index.theme",
          "[Icon Theme]\nName=Bright\nInherits=plain,hicolor\nDirectories=32\n[32]\nSize=32\n");
    write("base/plain/index.theme",
          "[Icon Theme]\nName=Plain\nInherits=bright\nDirectories=32\n[32]\nSize=32\n");
  }

  void write(const std::string& name, const std::string& text = "picture") {
    fs::create_directories(fs::path(directory_ / name).parent_path());
    std::ofstream(directory_ / name) << text;
  }

  [[nodiscard]] std::string found(const std::string& name, int side,
                                  const std::string& theme = "hicolor") const {
    const IconThemes themes({directory_ / "own", directory_ / "base"}, {directory_ / "pixmaps"},
                            theme);
    const auto icon = themes.find(name, side);
    return icon ? icon->path.substr(directory_.path().size() + 1) : "none";
  }

  TemporaryDirectory directory_;
};

TEST_F(IconThemesTest, TheNearestThatIsNoSmallerIsTaken) {
  for (const char* size : {"16x16", "48x48", "128x128"})
    write("base/hicolor/" + std::string(size) + "/apps/notes.png");
  EXPECT_EQ(found("notes", 16), "base/hicolor/16x16/apps/notes.png");
  EXPECT_EQ(found("notes", 17), "base/hicolor/48x48/apps/notes.png");
  EXPECT_EQ(found("notes", 64), "base/hicolor/128x128/apps/notes.png");
  EXPECT_EQ(found("notes", 200), "base/hicolor/128x128/apps/notes.png") << "the largest";
}

TEST_F(IconThemesTest, ADrawingFitsEverySizeAndAFolderForDenseScreensCountsItsPixels) {
  write("base/hicolor/48x48/apps/notes.png");
  write("base/hicolor/48x48@2/apps/notes.png");
  EXPECT_EQ(found("notes", 90), "base/hicolor/48x48@2/apps/notes.png");
  write("base/hicolor/any/apps/notes.svg");
  EXPECT_EQ(found("notes", 90), "base/hicolor/any/apps/notes.svg");
  EXPECT_EQ(found("notes", 48), "base/hicolor/48x48/apps/notes.png");
}

TEST_F(IconThemesTest, TheThemeThatIsSetComesFirstThenItsParentsThenHicolor) {
  write("base/hicolor/48x48/apps/notes.png");
  EXPECT_EQ(found("notes", 48, "bright"), "base/hicolor/48x48/apps/notes.png");
  write("base/plain/32/notes.png");
  EXPECT_EQ(found("notes", 48, "bright"), "base/plain/32/notes.png");
  write("base/bright/32/notes.png");
  EXPECT_EQ(found("notes", 48, "bright"), "base/bright/32/notes.png");
  EXPECT_EQ(found("notes", 48, "unknown"), "base/hicolor/48x48/apps/notes.png");
}

TEST_F(IconThemesTest, TheUsersIconsExtendTheMachinesThemes) {
  write("own/hicolor/48x48/apps/notes.png");
  EXPECT_EQ(found("notes", 48), "own/hicolor/48x48/apps/notes.png");
}

TEST_F(IconThemesTest, SinglePicturesAndPathsAreFoundToo) {
  write("pixmaps/notes.png");
  EXPECT_EQ(found("notes", 48), "pixmaps/notes.png");
  EXPECT_EQ(found("notes.png", 48), "pixmaps/notes.png");
  EXPECT_EQ(found(directory_ / "pixmaps/notes.png", 48), "pixmaps/notes.png");
  EXPECT_EQ(found(directory_ / "pixmaps/other.png", 48), "none");
}

TEST_F(IconThemesTest, ANameDoesNotLeaveTheFolders) {
  write("secret.png");
  for (const char* name : {"../secret", "", ".", "a/b", "..", "pixmaps/../../secret"})
    EXPECT_EQ(found(name, 48), "none") << name;
}

}  // namespace
}  // namespace yomber
