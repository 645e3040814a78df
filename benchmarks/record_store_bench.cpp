// The record store's content: bringing a large asset back, verified, beside cp of the same file
// with the same cold cache; and storing and recording many small files beside cp -r and sync of
// them.

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "benchmarks/figure.h"
#include "platform/foundation/temporary_directory.h"
#include "platform/rozzel/container.h"
#include "platform/rozzel/embedded_engine.h"

namespace {

using namespace yomber;

constexpr std::size_t kMiB = 1 << 20;
constexpr std::size_t kFilesInGroup = 500;

void require(const NSErrorRef& error) {
  if (!error) return;
  std::fprintf(stderr, "record_store_bench: %s\n", error->description().c_str());
  std::exit(1);
}

void runCommand(const std::string& command) {
  if (std::system(command.c_str()) != 0) {  // NOLINT: cp is the yardstick
    std::fprintf(stderr, "record_store_bench: failed: %s\n", command.c_str());
    std::exit(1);
  }
}

FileDescriptor openFile(const std::string& path, int flags) {
  FileDescriptor file(open(path.c_str(), flags | O_CLOEXEC, 0600));
  if (!file) require(NSError::errorWithErrno(errno, path));
  return file;
}

/// Takes a file out of the page cache, so that the next reader gets it from the disk.
void cool(const std::string& path) {
  const auto file = openFile(path, O_RDONLY);
  fdatasync(file.get());
  posix_fadvise(file.get(), 0, 0, POSIX_FADV_DONTNEED);
}

class StoreBench {
 public:
  StoreBench() {
    require(EmbeddedEngine::create(directory_ / "store"));
    engine_ = std::make_shared<EmbeddedEngine>(directory_ / "store");
    database_ = RZContainer(engine_, "bench", "bench").privateCloudDatabase();
    require(database_->createZone(zone_));
  }

  bool measureLargeAsset(std::size_t mebibytes, std::size_t rounds) {
    const RZAsset asset = storeLargeAsset(mebibytes);
    const std::string source =
        directory_ / ("store/assets/" + asset.hexHash().substr(0, 2) + "/" + asset.hexHash());
    const std::string target = directory_ / "target";
    bench::Repeated measured;
    for (std::size_t round = 0; round < rounds; ++round) {
      cool(source);
      const double copied = bench::secondsFor([&] { runCommand("cp " + source + " " + target); });
      std::filesystem::remove(target);
      cool(source);
      const double provided = bench::secondsFor([&] { provide(asset, target); });
      std::filesystem::remove(target);
      measured.add(provided, copied);
    }
    return print(measured, "verified copy of " + std::to_string(mebibytes) + " MiB", "cp", 1.3);
  }

  bool measureSmallFiles(std::size_t count, std::size_t rounds) {
    const std::string files = directory_ / "files";
    bench::Repeated measured;
    for (std::size_t round = 0; round < rounds; ++round) {
      makeFiles(files, count, round);
      const double copied =
          bench::secondsFor([&] { runCommand("cp -r " + files + " " + files + "-copy && sync"); });
      std::filesystem::remove_all(files + "-copy");
      measured.add(bench::secondsFor([&] { storeFiles(files, count, round); }), copied);
      std::filesystem::remove_all(files);
    }
    return print(measured, "store and record " + std::to_string(count) + " files of 4 KiB",
                 "cp -r and sync", 6);
  }

 private:
  RZAsset storeLargeAsset(std::size_t mebibytes) {
    NSErrorRef error;
    const auto group = engine_->newAssetGroup(&error);
    require(error);
    const auto writer = group->newWriter(&error);
    require(error);
    std::vector<std::byte> bytes(kMiB);
    std::uint32_t state = 1;
    for (std::size_t index = 0; index < mebibytes; ++index) {
      for (std::byte& byte : bytes) {
        state = state * 1664525 + 1013904223;
        byte = static_cast<std::byte>(state >> 24U);
      }
      require(writer->write(bytes));
    }
    RZAsset asset;
    require(writer->finish(asset));
    require(group->commit());
    return asset;
  }

  void provide(const RZAsset& asset, const std::string& target) {
    const auto file = openFile(target, O_RDWR | O_CREAT | O_EXCL);
    if (ftruncate(file.get(), static_cast<off_t>(asset.size)) != 0) {
      require(NSError::errorWithErrno(errno, target));
    }
    require(engine_->copyAsset(asset, file.get(), {}));
  }

  static void makeFiles(const std::string& folder, std::size_t count, std::size_t round) {
    std::filesystem::create_directory(folder);
    for (std::size_t index = 0; index < count; ++index) {
      std::string content = std::to_string(round) + ":" + std::to_string(index);
      content.resize(4096, 'x');
      const auto file = openFile(folder + "/" + std::to_string(index), O_WRONLY | O_CREAT);
      if (write(file.get(), content.data(), content.size()) < 0) {
        require(NSError::errorWithErrno(errno, folder));
      }
    }
    sync();
  }

  void storeFiles(const std::string& folder, std::size_t count, std::size_t round) {
    for (std::size_t first = 0; first < count; first += kFilesInGroup) {
      NSErrorRef error;
      const auto group = engine_->newAssetGroup(&error);
      require(error);
      RZRecordBatch batch;
      for (std::size_t index = first; index < std::min(count, first + kFilesInGroup); ++index) {
        const std::string name = std::to_string(index);
        RZAsset asset;
        require(group->importAsset(openFile(folder + "/" + name, O_RDONLY).get(), {}, asset));
        const auto record = std::make_shared<RZRecord>(
            "document", RZRecordID(std::to_string(round) + "/" + name, zone_));
        record->setObject(asset, "content");
        record->setObject(name, "name");
        batch.recordsToSave.push_back(record);
      }
      require(group->commit());
      std::vector<RZRecordRef> saved;
      require(database_->modifyRecords(batch, saved));
    }
  }

  static bool print(const bench::Repeated& measured, const std::string& name,
                    const std::string& yardstick, double goal) {
    char text[64];
    std::snprintf(text, sizeof text, "at most %g times", goal);
    const auto figure =
        measured.figure(name, "s", yardstick, text, [goal](double ratio) { return ratio <= goal; });
    bench::print(figure);
    return figure.reached;
  }

  const TemporaryDirectory directory_;
  const RZRecordZoneID zone_{"documents"};
  std::shared_ptr<EmbeddedEngine> engine_;
  RZDatabaseRef database_;
};

}  // namespace

int main() {
  const std::size_t mebibytes = bench::sizeFromEnvironment("YOMBER_BENCH_MEBIBYTES", 1024);
  const std::size_t files = bench::sizeFromEnvironment("YOMBER_BENCH_FILES", 10'000);
  const std::size_t rounds = bench::sizeFromEnvironment("YOMBER_BENCH_ROUNDS", 5);
  StoreBench store;
  const bool isLargeReached = store.measureLargeAsset(mebibytes, rounds);
  const bool isSmallReached = store.measureSmallFiles(files, rounds);
  return isLargeReached && isSmallReached ? 0 : 1;
}
