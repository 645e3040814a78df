// What file managers find in the desktop's own store of thumbnails, of pictures that are away.
#include <sys/stat.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>

#include <gtest/gtest.h>

#include "platform/foundation/fault_attributes.h"
#include "platform/foundation/temporary_directory.h"
#include "platform/glimmet/thumbnail_cache.h"
#include "tests/harness/content_client.h"
#include "tests/harness/file_contents.h"
#include "tests/harness/mounted_drive.h"
#include "tests/harness/stored_thumbnails.h"

namespace yomber::testing {
namespace {

namespace fs = std::filesystem;
using Flavour = ThumbnailCache::Flavour;
using Local = ContentClient::Local;
using Upload = ContentClient::Upload;

/// More than what the extension brings here for a thumbnailer's sake.
constexpr std::uintmax_t kLarge = (std::uintmax_t{64} << 20U) + 4096;
/// More than what an evicted file keeps; readers of pictures pass over the zeros.
constexpr std::uintmax_t kSmall = 100'000;

constexpr const char* kLookingAgain = "mount.thumbnail.again";
/// What was missed is looked at again without a pause.
constexpr const char* kPauseSkipped = "mount.thumbnail.missed";

/// A folder for what desktops cache, told to every process that the test starts.
class CacheFolder {
 public:
  CacheFolder() { setenv("XDG_CACHE_HOME", directory_.path().c_str(), 1); }
  [[nodiscard]] std::string thumbnails() const { return directory_ / "thumbnails"; }

 private:
  TemporaryDirectory directory_;
};

class DesktopThumbnailsTest : public ::testing::Test {
 protected:
  explicit DesktopThumbnailsTest(const std::vector<std::string>& gates = {},
                                 const std::vector<std::string>& failing = {})
      : mounted_(gates, failing) {}

  /// A picture that is in the store only.
  void makeAway(const std::string& name, const std::string& sample) {
    makeAway(name, contentOf(YOMBER_PICTURES "/" + sample), kSmall);
  }
  /// The same of any bytes, with zeros up to that size.
  void makeAway(const std::string& name, const std::string& bytes, std::uintmax_t size) {
    fs::create_directories(fs::path(mounted_.at(name)).parent_path());
    std::ofstream(mounted_.at(name), std::ios::binary) << bytes;
    fs::resize_file(mounted_.at(name), size);
    const std::string onDisk = mounted_.onDisk(name);
    ASSERT_TRUE(eventually([&] {
      const auto state = client_.state(onDisk);
      return state.upload == Upload::CONFIRMED && state.size == size;
    }));
    ASSERT_EQ(client_.evict(onDisk), nullptr);
    ASSERT_TRUE(isFaultAtPath(onDisk));
  }

  /// How many contents have come or gone.
  [[nodiscard]] nlohmann::json transfers() {
    return mounted_.drive().status().at("transfers").at("finished");
  }

  [[nodiscard]] bool isThere(const std::string& name, Flavour flavour) const {
    struct stat status{};
    if (lstat(mounted_.at(name).c_str(), &status) != 0) return false;
    return cache_.has({.path = mounted_.at(name), .mtime = status.st_mtim.tv_sec, .size = 0},
                      flavour);
  }

  CacheFolder folder_;
  const ThumbnailCache cache_{folder_.thumbnails()};
  MountedDrive mounted_;
  ContentClient client_{mounted_.drive().home()};
};

TEST_F(DesktopThumbnailsTest, WhatIsGivenUpHasItsPictureThereAndStaysAway) {
  makeAway("photo.jpg", "quarters.jpg");
  makeAway("Summer/my sea.png", "translucent.png");
  for (const char* name : {"photo.jpg", "Summer/my sea.png"}) {
    for (const Flavour flavour : {Flavour::Normal, Flavour::Large})
      EXPECT_TRUE(eventually([&] { return isThere(name, flavour); })) << name;
    EXPECT_TRUE(isFaultAtPath(mounted_.onDisk(name))) << name;
  }
  const std::string entry = contentOf(cache_.entryPath(mounted_.at("photo.jpg"), Flavour::Large));
  EXPECT_TRUE(entry.starts_with("\x89PNG"));
  EXPECT_NE(entry.find("Thumb::Size"), std::string::npos);
  EXPECT_FALSE(fs::exists(folder_.thumbnails() + "/fail"));
}

TEST_F(DesktopThumbnailsTest, WhatWasAwayBeforeTheMountHasItsPictureToo) {
  makeAway("Summer/photo.jpg", "quarters.jpg");
  mounted_.unmount();
  fs::remove_all(folder_.thumbnails());
  mounted_.mount();
  EXPECT_TRUE(eventually([&] { return isThere("Summer/photo.jpg", Flavour::Large); }));
  EXPECT_TRUE(isFaultAtPath(mounted_.onDisk("Summer/photo.jpg")));
}

TEST_F(DesktopThumbnailsTest, AMovedPictureHasItsPictureAtItsNewPlace) {
  makeAway("photo.jpg", "quarters.jpg");
  fs::create_directory(mounted_.at("Summer"));
  fs::rename(mounted_.at("photo.jpg"), mounted_.at("Summer/sea.jpg"));
  EXPECT_TRUE(eventually([&] { return isThere("Summer/sea.jpg", Flavour::Normal); }));
  EXPECT_TRUE(isFaultAtPath(mounted_.onDisk("Summer/sea.jpg")));
}

/// The library that file managers ask, through its own program.
TEST_F(DesktopThumbnailsTest, ADesktopFindsThePicture) {
  if (runProcess({"/bin/sh", "-c", "command -v gio"}).exitCode != 0)
    GTEST_SKIP() << "gio is not installed (libglib2.0-bin)";
  makeAway("Summer/m\xc3\xa4rz #1 (50%).jpg", "quarters.jpg");
  const std::string path = mounted_.at("Summer/m\xc3\xa4rz #1 (50%).jpg");
  ProcessResult asked;
  EXPECT_TRUE(eventually([&] {
    asked = runProcess({"/bin/sh", "-c", "exec gio info -a 'thumbnail::*' \"$0\"", path});
    return asked.output.find("thumbnail::path: " + folder_.thumbnails()) != std::string::npos &&
           asked.output.find("thumbnail::is-valid: TRUE") != std::string::npos;
  })) << asked.output
      << asked.errors;
  EXPECT_TRUE(isFaultAtPath(mounted_.onDisk("Summer/m\xc3\xa4rz #1 (50%).jpg")));
}

TEST_F(DesktopThumbnailsTest, WhatIsHereIsLeftToTheDesktop) {
  fs::copy_file(YOMBER_PICTURES "/quarters.jpg", mounted_.at("here.jpg"));
  makeAway("away.jpg", "wide-gamut.jpg");
  EXPECT_TRUE(eventually([&] { return isThere("away.jpg", Flavour::Large); }));
  EXPECT_FALSE(isThere("here.jpg", Flavour::Large));
}

TEST_F(DesktopThumbnailsTest, ALargePictureThatIsAwayHasItsPictureThereAndStaysAway) {
  makeAway("large.jpg", contentOf(YOMBER_PICTURES "/quarters.jpg"), kLarge);
  const auto before = transfers();
  for (const Flavour flavour : {Flavour::Normal, Flavour::Large})
    EXPECT_TRUE(eventually([&] { return isThere("large.jpg", flavour); }));
  EXPECT_EQ(client_.state(mounted_.onDisk("large.jpg")).local, Local::FAULT);
  EXPECT_EQ(transfers(), before);
}

/// The mount looks at what it has missed again as soon as the gate is opened.
class LaterDesktopThumbnailsTest : public DesktopThumbnailsTest {
 protected:
  LaterDesktopThumbnailsTest() : DesktopThumbnailsTest({kLookingAgain}, {kPauseSkipped}) {
    const fs::path thumbnailers =
        fs::path(mounted_.drive().environment().at("XDG_DATA_HOME")) / "thumbnailers";
    fs::create_directories(thumbnailers);
    std::ofstream(thumbnailers / "nothing.thumbnailer")
        << "[Thumbnailer Entry]\nExec=false\nMimeType=image/jpeg;\n";
  }
};

TEST_F(LaterDesktopThumbnailsTest, AThumbnailThatIsStoredLaterComesThereWithoutAListing) {
  makeAway("photo.jpg", "no picture", kSmall);
  ASSERT_TRUE(eventually([&] { return mounted_.isReached(kLookingAgain); }));
  EXPECT_FALSE(isThere("photo.jpg", Flavour::Large));
  StoredThumbnails(mounted_.drive())
      .put({client_.identifierAt(mounted_.onDisk("photo.jpg"))},
           [](std::size_t) { return contentOf(YOMBER_PICTURES "/quarters.jpg"); });
  mounted_.openGate(kLookingAgain);
  EXPECT_TRUE(eventually([&] { return isThere("photo.jpg", Flavour::Large); }));
}

TEST_F(LaterDesktopThumbnailsTest, ALargeOneWithoutAThumbnailIsNotBroughtHereForOne) {
  makeAway("large.jpg", "no picture", kLarge);
  const auto before = transfers();
  ASSERT_TRUE(eventually([&] { return mounted_.isReached(kLookingAgain); }));
  EXPECT_EQ(client_.state(mounted_.onDisk("large.jpg")).local, Local::FAULT);
  EXPECT_EQ(transfers(), before);
}

}  // namespace
}  // namespace yomber::testing
