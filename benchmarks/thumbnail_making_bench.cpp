// Thumbnails made as zarn makes them at upload, beside vipsthumbnail over the same pictures in the
// same round.

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <random>
#include <string>
#include <vector>

#include "benchmarks/figure.h"
#include "platform/drawing/picture_drawer.h"
#include "platform/foundation/file_descriptor.h"
#include "platform/foundation/temporary_directory.h"

namespace {

using namespace yomber;
namespace fs = std::filesystem;

[[noreturn]] void giveUp(const std::string& text) {
  std::fprintf(stderr, "thumbnail_making_bench: %s\n", text.c_str());
  std::exit(1);
}

void run(const std::string& command) {
  if (std::system(command.c_str()) != 0) giveUp("cannot run: " + command);
}

/// As a camera makes them: 12 million pixels, smooth with some noise.
void makePictures(const fs::path& folder, std::size_t count) {
  constexpr int kWidth = 4000;
  constexpr int kHeight = 3000;
  const fs::path raw = folder / "raw.ppm";
  for (std::size_t i = 0; i < count; ++i) {
    std::minstd_rand random(static_cast<unsigned>(i + 1));
    std::string pixels;
    pixels.reserve(std::size_t{kWidth} * kHeight * 3);
    for (int y = 0; y < kHeight; ++y) {
      for (int x = 0; x < kWidth; ++x) {
        const int noise = static_cast<int>(random() % 24);
        pixels += static_cast<char>((x / 20 + noise) & 0xff);
        pixels += static_cast<char>((y / 15 + noise) & 0xff);
        pixels += static_cast<char>(((x + y) / 30 + noise) & 0xff);
      }
    }
    std::ofstream(raw, std::ios::binary) << "P6 " << kWidth << " " << kHeight << " 255\n" << pixels;
    run("vips jpegsave " + raw.string() + " " + (folder / std::to_string(i)).string() +
        ".jpg --Q 88");
  }
  fs::remove(raw);
}

std::vector<std::string> picturesIn(const fs::path& folder) {
  std::vector<std::string> result;
  for (const auto& each : fs::directory_iterator(folder)) result.push_back(each.path());
  std::ranges::sort(result);
  return result;
}

void drawAll(PictureDrawer& drawer, const std::vector<std::string>& pictures) {
  for (const std::string& path : pictures) {
    const FileDescriptor file(open(path.c_str(), O_RDONLY | O_CLOEXEC));
    NSErrorRef error;
    const auto picture = drawer.draw(file.get(), 1024, drawing::Form::Smallest, &error);
    if (!picture) giveUp(path + ": " + error->description());
  }
}

}  // namespace

int main() {
  if (std::system("vipsthumbnail --vips-version >/dev/null 2>&1") != 0) {
    std::printf("thumbnail-making: not measured, vipsthumbnail is missing (libvips-tools)\n");
    return 0;
  }
  const TemporaryDirectory directory;
  const fs::path originals = directory / "originals";
  fs::create_directories(originals);
  const std::size_t count = bench::sizeFromEnvironment("YOMBER_BENCH_PICTURES", 24);
  makePictures(originals, count);
  const std::vector<std::string> pictures = picturesIn(originals);
  std::string names;
  for (const std::string& path : pictures) names += " " + path;
  // The same result: no larger than the original, in sRGB, as good a JPEG.
  const std::string peer = "vipsthumbnail --size '1024x1024>' --output '" +
                           (directory / "%s.out.jpg") + "[Q=85,strip]'" + names;
  bench::Repeated making;
  for (int round = 0; round < 5; ++round) {
    // With the process's start, which zarn has once for many uploads.
    PictureDrawer drawer;
    const double ours = bench::secondsFor([&] { drawAll(drawer, pictures); });
    const double theirs = bench::secondsFor([&] { run(peer); });
    making.add(1e3 * ours / static_cast<double>(count), 1e3 * theirs / static_cast<double>(count));
  }
  const auto figure =
      making.figure("a thumbnail of 12 Mpixel at upload", "ms", "vipsthumbnail, all in one call",
                    "<= 1.3", [](double ratio) { return ratio <= 1.3; });
  print(figure);
  return figure.reached ? 0 : 1;
}
