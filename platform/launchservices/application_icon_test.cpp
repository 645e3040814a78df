#include "platform/launchservices/application_icon.h"

#include <gtest/gtest.h>
#include <stdlib.h>

#include <filesystem>
#include <fstream>

#include "platform/foundation/temporary_directory.h"

namespace yomber {
namespace {

namespace fs = std::filesystem;

class ApplicationIconTest : public testing::Test {
 protected:
  void SetUp() override {
    for (const char* name : {"XDG_DATA_HOME", "XDG_DATA_DIRS", "XDG_CONFIG_HOME", "HOME"})
      setenv(name, directory_.path().c_str(), 1);
    fs::create_directories(hicolor_ + "/48x48/apps");
    fs::create_directories(hicolor_ + "/any/apps");
    std::ofstream(hicolor_ + "/index.theme")
        << "[Icon Theme]\nDirectories=48x48/apps,any/apps\n[48x48/apps]\nSize=48\n[any/apps]\n"
           "Size=48\nType=Scalable\n";
  }

  void install(const std::string& sample, const std::string& name) const {
    fs::copy_file(fs::path(YOMBER_PICTURES) / sample, hicolor_ + "/" + name);
  }

  /// The larger side of a PNG.
  static int sideOf(const ApplicationIcon& icon) {
    const std::string_view bytes = icon.data->bytes();
    EXPECT_TRUE(bytes.starts_with("\x89PNG"));
    return static_cast<unsigned char>(bytes.at(19)) +
           256 * static_cast<unsigned char>(bytes.at(18));
  }

  TemporaryDirectory directory_;
  const std::string hicolor_ = directory_ / "icons/hicolor";
};

TEST_F(ApplicationIconTest, AnIconOfTheRightSizeIsGivenAsItIs) {
  install("quarters.png", "48x48/apps/notes.png");
  const auto icon = bestFittingIcon("notes", 48);
  ASSERT_TRUE(icon);
  EXPECT_EQ(icon->data->length(), fs::file_size(hicolor_ + "/48x48/apps/notes.png"));
  EXPECT_FALSE(icon->isBare);
}

TEST_F(ApplicationIconTest, ALargerOneIsScaledDownAndASmallerOneIsNotScaledUp) {
  install("quarters.png", "48x48/apps/notes.png");
  const auto small = bestFittingIcon("notes", 24);
  ASSERT_TRUE(small);
  EXPECT_EQ(sideOf(*small), 24);
  const auto large = bestFittingIcon("notes", 120);
  ASSERT_TRUE(large);
  EXPECT_EQ(sideOf(*large), 48);
}

TEST_F(ApplicationIconTest, ADrawingIsDrawnInTheSizeThatIsWanted) {
  install("quarters.svg", "any/apps/notes.svg");
  const auto icon = bestFittingIcon("notes", 120);
  ASSERT_TRUE(icon);
  EXPECT_EQ(sideOf(*icon), 120);
}

TEST_F(ApplicationIconTest, WhatIsNoIconOfAThemeIsBare) {
  install("quarters.png", "48x48/apps/notes-symbolic.png");
  EXPECT_TRUE(bestFittingIcon("notes-symbolic", 48).value().isBare);
  EXPECT_TRUE(bestFittingIcon(std::string(YOMBER_PICTURES) + "/quarters.png", 48).value().isBare);
}

TEST_F(ApplicationIconTest, ThereMayBeNone) {
  EXPECT_FALSE(bestFittingIcon("unknown", 48));
  EXPECT_FALSE(bestFittingIcon("", 48));
  install("quarters.png", "48x48/apps/notes.png");
  EXPECT_FALSE(bestFittingIcon("notes", 0));
  EXPECT_FALSE(bestFittingIcon("notes", -5));
  std::ofstream(hicolor_ + "/48x48/apps/rubbish.png") << "no picture";
  EXPECT_FALSE(bestFittingIcon("rubbish", 48));
}

}  // namespace
}  // namespace yomber
