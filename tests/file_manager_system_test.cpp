// A file manager that people use (PCManFM), on a screen of its own, in a folder of documents that
// are away.
//
// YOMBER_DOCUMENTS says how many; it is printed.
#include <sys/stat.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>
#include <utility>

#include <arpa/inet.h>
#include <gtest/gtest.h>

#include "platform/foundation/fault_attributes.h"
#include "platform/foundation/sanitized.h"
#include "platform/foundation/temporary_directory.h"
#include "tests/harness/content_client.h"
#include "tests/harness/file_contents.h"
#include "tests/harness/mounted_drive.h"

namespace yomber::testing {
namespace {

namespace fs = std::filesystem;
using Upload = ContentClient::Upload;

int documents() {
  constexpr int kDocuments = kIsSanitized ? 100 : 1000;
  if (kIsSanitized) std::puts("fewer documents under a sanitizer, where everything takes longer");
  const char* const text = std::getenv("YOMBER_DOCUMENTS");
  const int count = text != nullptr ? std::atoi(text) : kDocuments;
  std::printf("%d documents\n", count);
  return count;
}

bool isInstalled(const std::string& program) {
  return runProcess({"/bin/sh", "-c", "command -v " + program}).exitCode == 0;
}

/// A screen that is only a file.
class Screen {
 public:
  Screen() {
    if (const auto number = server_.nextLine(std::chrono::steady_clock::now() + patience)) {
      display_ = ":" + *number;
    }
  }
  /// Empty when there is none.
  [[nodiscard]] const std::string& display() const { return display_; }

  /// Pixels that are magenta, which nothing on a desktop is but our pictures.
  [[nodiscard]] std::size_t magentaPixels() const {
    const std::string image = contentOf(folder_ / "Xvfb_screen0");
    std::size_t count = 0;
    for (std::size_t at = pixelsIn(image); at + 4 <= image.size(); at += 4) {
      const auto blue = static_cast<unsigned char>(image[at]);
      const auto green = static_cast<unsigned char>(image[at + 1]);
      const auto red = static_cast<unsigned char>(image[at + 2]);
      if (blue > 200 && green < 60 && red > 200) ++count;
    }
    return count;
  }

 private:
  /// Where they begin in a dump of a window (XWD): behind its header and its table of colours.
  static std::size_t pixelsIn(const std::string& image) {
    constexpr std::size_t kHeaderSize = 0;
    constexpr std::size_t kColours = 19;
    constexpr std::size_t kColourSize = 12;
    const auto field = [&](std::size_t number) {
      std::uint32_t value = 0;
      if (image.size() >= (number + 1) * sizeof value)
        std::memcpy(&value, image.data() + number * sizeof value, sizeof value);
      return ntohl(value);
    };
    return field(kHeaderSize) + field(kColours) * kColourSize;
  }

  TemporaryDirectory folder_;
  LineProcess server_{{"/usr/bin/env", "Xvfb", "-displayfd", "1", "-screen", "0", "1024x768x24",
                       "-fbdir", folder_.path()}};
  std::string display_;
};

/// Where desktops keep what is theirs, told to every process that the test starts.
class DesktopFolders {
 public:
  DesktopFolders() {
    for (const char* name : {"XDG_CACHE_HOME", "XDG_CONFIG_HOME", "XDG_DATA_HOME"}) {
      setenv(name, (folder_ / name).c_str(), 1);
    }
  }

  /// How many pictures the desktop's store has.
  [[nodiscard]] int thumbnails() const {
    std::error_code none;
    const fs::directory_iterator entries(folder_ / "XDG_CACHE_HOME/thumbnails/normal", none);
    return static_cast<int>(std::distance(begin(entries), end(entries)));
  }

 private:
  TemporaryDirectory folder_;
};

class FileManager : public ::testing::Test {
 protected:
  /// Every other one is a text, which only its beginning tells.
  static bool isPicture(int number) { return number % 2 == 0; }
  static std::string name(int number) {
    return "mixed/" + std::to_string(number) + (isPicture(number) ? ".jpg" : "");
  }
  void makeAllAway() {
    const std::string picture = contentOf(YOMBER_PICTURES "/magenta.jpg");
    fs::create_directory(mounted_.at("mixed"));
    for (int i = 0; i < count_; ++i) {
      std::ofstream file(mounted_.at(name(i)), std::ios::binary);
      // More than what an evicted file keeps; readers of pictures pass over what is behind them.
      if (isPicture(i)) {
        file << picture << someContent(20'000, static_cast<std::uint32_t>(i + 1));
      } else {
        for (int line = 0; line < 1000; ++line) file << "line " << line << " of text " << i << "\n";
      }
    }
    for (int i = 0; i < count_; ++i) {
      const std::string path = mounted_.onDisk(name(i));
      ASSERT_TRUE(eventually([&] { return client_.state(path).upload == Upload::CONFIRMED; })) << i;
    }
    const auto evicted = mounted_.drive().yomber({"evict", "mixed"}, std::chrono::minutes(5));
    ASSERT_EQ(evicted.exitCode, 0) << evicted.errors;
  }
  int away() {
    int result = 0;
    for (int i = 0; i < count_; ++i) result += isFaultAtPath(mounted_.onDisk(name(i))) ? 1 : 0;
    return result;
  }

  /// How many uploads, downloads and evictions there have been.
  std::size_t transfers() { return mounted_.drive().status().at("transfers").at("finished"); }

  const int count_ = documents();
  DesktopFolders folders_;
  MountedDrive mounted_;
  ContentClient client_{mounted_.drive().home()};
};

TEST_F(FileManager, ShowsThePicturesOfWhatIsAwayAndDownloadsNothing) {
  if (!isInstalled("pcmanfm") || !isInstalled("Xvfb"))
    GTEST_SKIP() << "pcmanfm and xvfb are not installed";
  makeAllAway();
  ASSERT_EQ(away(), count_);
  // A file manager that comes before a picture is there draws its own.
  ASSERT_TRUE(eventually([&] { return folders_.thumbnails() == (count_ + 1) / 2; }));
  const Screen screen;
  ASSERT_NE(screen.display(), "");
  ASSERT_EQ(screen.magentaPixels(), 0U);
  const std::size_t before = transfers();
  const LineProcess manager({"/usr/bin/env", "pcmanfm", mounted_.at("mixed")},
                            {{"DISPLAY", screen.display()}});
  constexpr std::size_t kOnePicture = 1000;
  std::size_t seen = 0;
  const auto areAllShown = [&] {
    const std::size_t pixels = screen.magentaPixels();
    return std::exchange(seen, pixels) == pixels && pixels > 5 * kOnePicture;
  };
  EXPECT_TRUE(eventually(areAllShown)) << seen;
  EXPECT_EQ(away(), count_);
  EXPECT_EQ(transfers(), before);
}

}  // namespace
}  // namespace yomber::testing
