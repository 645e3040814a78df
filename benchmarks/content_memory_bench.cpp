// The most memory that zarn and the extension ever have while a file goes into a whole drive, up to
// the store, away and back: once for a file of moderate size, then for a large one.

#include <filesystem>
#include <fstream>
#include <stdexcept>
#include <string>
#include <vector>

#include "benchmarks/figure.h"
#include "benchmarks/process_use.h"
#include "tests/harness/test_drive.h"

namespace {

using namespace yomber;
using Process = testing::TestDrive::Process;
namespace fs = std::filesystem;

constexpr std::chrono::minutes kPatience{10};

void run(const testing::TestDrive& drive, const std::vector<std::string>& arguments) {
  const testing::ProcessResult result = drive.yomber(arguments, kPatience);
  if (result.exitCode != 0) throw std::runtime_error(arguments[0] + ": " + result.errors);
}

void takeThrough(const testing::TestDrive& drive, const std::string& name, std::size_t bytes) {
  const std::string source = fs::path(drive.home()).parent_path() / name;
  std::ofstream file(source, std::ios::binary);
  std::vector<char> block(1 << 20);
  for (std::size_t done = 0; done < bytes; done += block.size()) {
    for (std::size_t i = 0; i < block.size(); ++i) block[i] = static_cast<char>(done / 7 + i * i);
    file.write(block.data(), static_cast<std::streamsize>(block.size()));
  }
  file.close();
  run(drive, {"put", source});
  const auto isUploaded = [&] { return drive.json({"stat", name}).at(0).at("uploaded") == true; };
  if (!testing::eventually(isUploaded, kPatience)) throw std::runtime_error("not uploaded");
  run(drive, {"evict", name});
  run(drive, {"provide", name});
}

bool print(const char* process, double moderate, double large) {
  constexpr double kMostGrowth = 2;  // MiB: whatever the allocator does by the way
  bench::Figure figure;
  figure.name = std::string("growth of the peak memory of ") + process + " with a large file";
  figure.value = large - moderate;
  figure.unit = "MiB";
  figure.goal = "at most 2 MiB";
  figure.reached = figure.value <= kMostGrowth;
  bench::print(figure);
  return figure.reached;
}

}  // namespace

int main() {
  const std::size_t moderate =
      bench::sizeFromEnvironment("YOMBER_BENCH_MODERATE_BYTES", 64UL << 20U);
  const std::size_t large = bench::sizeFromEnvironment("YOMBER_BENCH_LARGE_BYTES", 1UL << 30U);
  testing::TestDrive drive;
  drive.up();
  const pid_t zarn = drive.pidOf(Process::Zarn);
  const pid_t extension = drive.pidOf(Process::Extension);
  takeThrough(drive, "moderate", moderate);
  const double zarnBefore = bench::peakMebibytes(zarn);
  const double extensionBefore = bench::peakMebibytes(extension);
  takeThrough(drive, "large", large);
  bool isReached = print("zarn", zarnBefore, bench::peakMebibytes(zarn));
  isReached &= print("the extension", extensionBefore, bench::peakMebibytes(extension));
  return isReached ? 0 : 1;
}
