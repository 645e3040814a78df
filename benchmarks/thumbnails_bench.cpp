// Thumbnails of many evicted files through extension and host, beside `cat` of the same thumbnail
// files and beside vipsthumbnail over local originals; how soon the first one comes, and what
// memory the extension has needed.

#include <stdlib.h>

#include <algorithm>
#include <array>
#include <chrono>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <functional>
#include <iostream>
#include <iterator>
#include <random>
#include <stdexcept>
#include <string>
#include <vector>

#include "benchmarks/figure.h"
#include "benchmarks/process_use.h"
#include "protocols/common.capnp.h"
#include "tests/harness/stored_thumbnails.h"
#include "tests/harness/test_drive.h"
#include "yomber/drive_client.h"
#include "yomber/drive_thumbnails.h"

namespace {

using namespace yomber;
namespace fs = std::filesystem;
using Clock = std::chrono::steady_clock;

constexpr std::chrono::minutes kPatience{10};
constexpr std::size_t kDistinct = 200;
constexpr int kRounds = 5;

void require(bool isDone, const std::string& text) {
  if (!isDone) throw std::runtime_error(text);
}

void require(const NSErrorRef& error) {
  if (error != nullptr) throw std::runtime_error(error->description());
}

testing::ProcessResult run(const std::vector<std::string>& command) {
  auto result = testing::runProcess(command, {}, kPatience);
  require(result.exitCode == 0, command[0] + ": " + result.errors);
  return result;
}

std::string contentOf(const std::string& path) {
  std::ifstream file(path, std::ios::binary);
  return {std::istreambuf_iterator<char>(file), {}};
}

/// Pictures as a store holds them, and how quickly they can be drawn from originals.
struct Pictures {
  std::vector<std::string> bytes;
  double drawnPerSecond = 0;  ///< 0: nobody here draws
};

bool canDraw() {
  for (const char* program : {"vips", "vipsthumbnail"}) {
    if (testing::runProcess({"/bin/sh", "-c", std::string("command -v ") + program}).exitCode !=
        0) {
      std::cout << "thumbnails: " << program
                << " is not installed (libvips-tools): not compared with drawing, and the pictures "
                   "are random bytes\n";
      return false;
    }
  }
  return true;
}

/// Twelve megapixels each, cut from one picture of noise at different places.
Pictures drawnPictures(const std::string& folder) {
  fs::create_directories(folder);
  run({"/usr/bin/env", "vips", "gaussnoise", folder + "/noise.v", "4400", "3400", "--mean", "128",
       "--sigma", "30"});
  run({"/usr/bin/env", "vips", "gaussblur", folder + "/noise.v", folder + "/soft.v", "3"});
  std::vector<std::string> originals;
  for (std::size_t i = 0; i < kDistinct; ++i) {
    originals.push_back(folder + "/o" + std::to_string(i) + ".jpg");
    run({"/usr/bin/env", "vips", "crop", folder + "/soft.v", originals.back(),
         std::to_string(2 * i), std::to_string(i), "4000", "3000"});
  }
  std::vector<std::string> command{"/usr/bin/env", "vipsthumbnail", "--size", "1024x1024",
                                   "-o",           "t_%s.jpg"};
  command.insert(command.end(), originals.begin(), originals.end());
  Pictures pictures;
  const double seconds = bench::secondsFor([&] { run(command); });
  pictures.drawnPerSecond = static_cast<double>(kDistinct) / seconds;
  for (std::size_t i = 0; i < kDistinct; ++i) {
    pictures.bytes.push_back(contentOf(folder + "/t_o" + std::to_string(i) + ".jpg"));
    require(!pictures.bytes.back().empty(), "vipsthumbnail wrote nothing");
  }
  return pictures;
}

Pictures randomPictures() {
  constexpr std::size_t kBytes = 80'000;
  Pictures pictures;
  std::minstd_rand random;
  for (std::size_t i = 0; i < kDistinct; ++i) {
    std::string bytes("\xff\xd8\xff\xe0");
    while (bytes.size() < kBytes) bytes += static_cast<char>(random());
    pictures.bytes.push_back(std::move(bytes));
  }
  return pictures;
}

/// A drive with that many documents, all evicted, each with one of the pictures as its thumbnail.
class Drive {
 public:
  Drive(std::size_t count, const Pictures& pictures) {
    drive_.makeFolder("photos");
    for (std::size_t i = 0; i < count; ++i) {
      drive_.write("photos/p" + std::to_string(i) + ".dat", "original " + std::to_string(i));
    }
    drive_.up();
    std::string folder;
    const auto areThere = [&] {
      return client_.identifierFor("photos", folder) == nullptr && list(folder) == count;
    };
    require(testing::eventually(areThere, kPatience), "the files do not show");
    const auto isUploaded = [&] { return list(folder) == count && uploaded_ == count; };
    require(testing::eventually(isUploaded, kPatience), "the files are not uploaded");
    const auto isEvicted = [&] {
      (void)drive_.yomber({"evict", "photos"}, kPatience);
      return list(folder) == count && downloaded_ == 0;
    };
    require(testing::eventually(isEvicted, kPatience), "the files are not evicted");
    const testing::StoredThumbnails stored(drive_);
    stored.put(identifiers_, [&](std::size_t i) { return pictures.bytes[i % kDistinct]; });
    for (std::size_t i = 0; i < std::min(kDistinct, count); ++i) {
      files_.push_back(stored.fileOf(identifiers_[i]));
    }
  }

  struct Delivery {
    double seconds = 0;
    double first = 0;  ///< seconds until the first
  };
  Delivery fetchAll(const std::function<void()>& meanwhile = {}) {
    Delivery delivery;
    std::size_t pictures = 0;
    const auto begin = Clock::now();
    const auto elapsed = [&] {
      return std::chrono::duration<double>(Clock::now() - begin).count();
    };
    require(fetchThumbnails(client_, identifiers_, {.width = 256, .height = 256},
                            [&](const ItemThumbnail& each) {
                              if (pictures == 0) delivery.first = elapsed();
                              if (each.image != nullptr) ++pictures;
                              if (meanwhile) meanwhile();
                            }));
    delivery.seconds = elapsed();
    require(pictures == identifiers_.size(), "thumbnails are missing");
    return delivery;
  }
  /// Seconds that `cat` takes for as many files.
  double catAll() {
    const std::string list = fs::path(drive_.home()).parent_path() / "files";
    std::ofstream names(list);
    for (std::size_t i = 0; i < identifiers_.size(); ++i) {
      names << files_[i % files_.size()] << '\n';
    }
    names.close();
    return bench::secondsFor(
        [&] { run({"/bin/sh", "-c", "xargs cat < " + list + " > /dev/null"}); });
  }
  /// What the extension has needed at most, the images under way included, in mebibytes.
  [[nodiscard]] double extensionPeak() {
    const pid_t extension = drive_.pidOf(testing::TestDrive::Process::Extension);
    double images = 0;
    (void)fetchAll([&] { images = std::max(images, bench::memoryFileMebibytes(extension)); });
    return images + bench::peakMebibytes(extension);
  }
  bool nothingWasDownloaded() {
    std::string folder;
    require(client_.identifierFor("photos", folder));
    (void)list(folder);
    return downloaded_ == 0;
  }

 private:
  std::size_t list(const std::string& folder) {
    constexpr std::uint32_t kDownloaded = protocol::ITEM_FLAG_DOWNLOADED;
    constexpr std::uint32_t kUploaded = protocol::ITEM_FLAG_UPLOADED;
    uploaded_ = 0;
    identifiers_.clear();
    downloaded_ = 0;
    require(client_.list(folder, protocol::SortOrder::NAME, [&](const auto& page) {
      for (const ItemFields& item : page) {
        identifiers_.push_back(item.identifier);
        if ((item.flags & kDownloaded) != 0) ++downloaded_;
        if ((item.flags & kUploaded) != 0) ++uploaded_;
      }
      return true;
    }));
    return identifiers_.size();
  }

  testing::TestDrive drive_;
  DriveClient client_{DrivePaths::forHome(drive_.home())};
  std::vector<std::string> identifiers_;
  std::size_t downloaded_ = 0;
  std::size_t uploaded_ = 0;
  std::vector<std::string> files_;
};

bool printAtMost(const std::string& name, double value, const std::string& unit, double most) {
  std::array<char, 32> goal{};
  std::snprintf(goal.data(), goal.size(), "at most %.0f %s", most, unit.c_str());
  bench::Figure figure;
  figure.name = name;
  figure.value = value;
  figure.unit = unit;
  figure.goal = goal.data();
  figure.reached = value <= most;
  bench::print(figure);
  return figure.reached;
}

bool printed(const bench::Figure& figure) {
  bench::print(figure);
  return figure.reached;
}

bool measure(std::size_t count, const std::string& folder) {
  const Pictures pictures = canDraw() ? drawnPictures(folder) : randomPictures();
  Drive drive(count, pictures);
  (void)drive.fetchAll();
  bench::Repeated deliveries;
  std::vector<double> firsts;
  std::vector<double> rates;
  const auto number = static_cast<double>(count);
  for (int round = 0; round < kRounds; ++round) {
    const Drive::Delivery delivery = drive.fetchAll();
    deliveries.add(number / delivery.seconds, number / drive.catAll());
    firsts.push_back(delivery.first * 1000);
    rates.push_back(number / delivery.seconds);
  }
  require(drive.nothingWasDownloaded(), "content was downloaded");
  bool isReached =
      printed(deliveries.figure("thumbnails delivered", "thumbnails/s", "cat", "at least 0.3 times",
                                [](double ratio) { return ratio >= 0.3; }));
  if (pictures.drawnPerSecond > 0) {
    isReached &= printed(bench::compared("thumbnails delivered", bench::percentile(rates, 0.5),
                                         "thumbnails/s", "vipsthumbnail over originals",
                                         pictures.drawnPerSecond, "at least 20 times",
                                         [](double ratio) { return ratio >= 20; }));
  }
  isReached &= printAtMost("first thumbnail", bench::percentile(firsts, 0.5), "ms", 100);
  isReached &= printAtMost("peak memory of the extension", drive.extensionPeak(), "MiB", 128);
  return isReached;
}

}  // namespace

int main() {
  unsetenv("XDG_RUNTIME_DIR");
  const std::size_t count = bench::sizeFromEnvironment("YOMBER_BENCH_THUMBNAILS", 10'000);
  std::string folder = fs::temp_directory_path() / "yomber-pictures.XXXXXX";
  require(mkdtemp(folder.data()) != nullptr, "no temporary folder");
  bool isReached = false;
  try {
    isReached = measure(count, folder);
  } catch (const std::exception& exception) {
    std::cerr << "thumbnails: " << exception.what() << '\n';
  }
  fs::remove_all(folder);
  return isReached ? 0 : 1;
}
