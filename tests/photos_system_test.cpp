// A folder of photos, all the way: uploaded, drawn meanwhile, evicted, and shown without their
// content.
//
// YOMBER_PHOTOS says how many; it is printed.
#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <map>
#include <random>
#include <set>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "platform/foundation/sanitized.h"
#include "platform/foundation/temporary_directory.h"
#include "tests/harness/file_contents.h"
#include "tests/harness/test_drive.h"
#include "yomber/drive_client.h"
#include "yomber/drive_thumbnails.h"

namespace yomber::testing {
namespace {

namespace fs = std::filesystem;

constexpr std::size_t kDistinct = 200;
constexpr std::chrono::minutes kPatience{5};

std::size_t photos() {
  constexpr std::size_t kPhotos = kIsSanitized ? 400 : 10'000;
  if (kIsSanitized) std::puts("fewer photos under a sanitizer, where everything takes longer");
  const char* const text = std::getenv("YOMBER_PHOTOS");
  const std::size_t count = text != nullptr ? std::strtoul(text, nullptr, 10) : kPhotos;
  std::printf("%zu photos\n", count);
  return count;
}

/// JPEGs of different pictures: each a colour of its own with some noise.
std::vector<std::string> distinctPictures() {
  constexpr int kWidth = 160;
  constexpr int kHeight = 120;
  const TemporaryDirectory folder;
  std::vector<std::string> command{"/usr/bin/env", "vipsthumbnail", "--size", "160x120",
                                   "-o",           "%s.jpg"};
  for (std::size_t i = 0; i < kDistinct; ++i) {
    std::minstd_rand random(static_cast<unsigned>(i + 1));
    command.push_back(folder / (std::to_string(i) + ".ppm"));
    std::string pixels;
    for (int pixel = 0; pixel < kWidth * kHeight; ++pixel) {
      for (const std::size_t colour : {i, 3 * i, 7 * i})
        pixels += static_cast<char>(colour % 200 + random() % 50);
    }
    std::ofstream(command.back(), std::ios::binary) << "P6 " << kWidth << " " << kHeight << " 255\n"
                                                    << pixels;
  }
  const auto made = runProcess(command, {}, kPatience);
  EXPECT_EQ(made.exitCode, 0) << made.errors;
  std::vector<std::string> pictures;
  for (std::size_t i = 0; i < kDistinct; ++i)
    pictures.push_back(contentOf(folder / (std::to_string(i) + ".jpg")));
  return pictures;
}

class Photos : public ::testing::Test {
 protected:
  Photos() { unsetenv("XDG_RUNTIME_DIR"); }

  /// How many have that mark.
  [[nodiscard]] std::size_t countOf(const char* mark) const {
    const auto items = drive_.json({"ls", "photos"});
    return static_cast<std::size_t>(
        std::ranges::count_if(items, [&](const auto& item) { return item.at(mark) == true; }));
  }
  void upWithPhotosAway() {
    const auto pictures = distinctPictures();
    ASSERT_EQ(std::set<std::string>(pictures.begin(), pictures.end()).size(), kDistinct);
    drive_.makeFolder("photos");
    for (std::size_t i = 0; i < count_; ++i)
      drive_.write("photos/" + std::to_string(i) + ".jpg", pictures[i % kDistinct]);
    drive_.up();
    ASSERT_TRUE(eventually([&] { return countOf("uploaded") == count_; }, kPatience));
    const auto isEvicted = [&] {
      (void)drive_.yomber({"evict", "photos"}, kPatience);
      return countOf("downloaded") == 0;
    };
    ASSERT_TRUE(eventually(isEvicted, kPatience));
    for (const auto& item : drive_.json({"ls", "photos"}))
      numbers_[item.at("id")] = std::stoul(item.at("name").get<std::string>());
    ASSERT_EQ(numbers_.size(), count_);
  }
  [[nodiscard]] std::size_t transfers() const {
    return drive_.status().at("transfers").at("finished");
  }

  const std::size_t count_ = photos();
  TestDrive drive_;
  std::map<std::string, std::size_t> numbers_;  ///< of the photos, by identifier
};

TEST_F(Photos, AreAllShownFromTheStoreWithoutAByteOfTheirContent) {
  ASSERT_NO_FATAL_FAILURE(upWithPhotosAway());
  const std::size_t before = transfers();
  std::vector<std::string> identifiers;
  for (const auto& [identifier, number] : numbers_) identifiers.push_back(identifier);
  std::map<std::size_t, std::set<std::string>> images;
  DriveClient client(DrivePaths::forHome(drive_.home()));
  const auto areDelivered = [&] {
    std::size_t delivered = 0;
    const NSErrorRef error = fetchThumbnails(
        client, identifiers, {.width = 256, .height = 256}, [&](const ItemThumbnail& each) {
          if (each.image == nullptr) return;
          ++delivered;
          images[numbers_.at(each.identifier) % kDistinct].emplace(each.image->bytes());
        });
    EXPECT_EQ(error, nullptr);
    return delivered == count_;
  };
  // What is not drawn while it is uploaded is drawn a little later.
  ASSERT_TRUE(eventually(areDelivered, kPatience));
  // Each picture's own, and the same one wherever it is.
  std::set<std::string> different;
  for (const auto& [number, own] : images) {
    EXPECT_EQ(own.size(), 1U) << number;
    different.insert(*own.begin());
  }
  EXPECT_EQ(different.size(), std::min(count_, kDistinct));
  EXPECT_EQ(transfers(), before);
  EXPECT_EQ(countOf("downloaded"), 0U);
}

}  // namespace
}  // namespace yomber::testing
