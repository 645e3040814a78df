// Files written and read through the mount at random, with their content given up now and then,
// beside a model of their bytes in memory.
//
// YOMBER_MOUNT_STEPS says how many operations are done, YOMBER_SEED which; it is printed.
#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <memory>
#include <random>
#include <string>
#include <vector>

#include <fcntl.h>
#include <linux/falloc.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "tests/harness/content_client.h"
#include "tests/harness/mounted_drive.h"

namespace yomber::testing {
namespace {

constexpr std::size_t kFiles = 4;
constexpr std::size_t kLargest = 300'000;
constexpr std::size_t kLongest = 40'000;  ///< one operation's bytes
/// One operation in so many is an eviction: it waits until the store has the content.
constexpr int kStepsToEviction = 400;

long numberFrom(const char* name, long otherwise) {
  const char* const text = std::getenv(name);
  return text != nullptr ? std::atol(text) : otherwise;
}

/// A file in the mount, and what it has to contain.
struct ModelFile {
  std::string name;
  std::string bytes;
  int descriptor = -1;
};

class MountModel : public ::testing::Test {
 protected:
  MountModel() : client_(mounted_.drive().home()) {}
  ~MountModel() override {
    for (const ModelFile& file : files_) close(file.descriptor);
  }

  std::size_t upTo(std::size_t most) {
    return std::uniform_int_distribution<std::size_t>(0, most)(random_);
  }
  std::string someBytes(std::size_t size) {
    std::string bytes(size, '\0');
    for (char& byte : bytes) byte = static_cast<char>(random_());
    return bytes;
  }
  ModelFile& anyFile() { return files_.at(upTo(kFiles - 1)); }

  void makeFiles() {
    for (std::size_t i = 0; i < kFiles; ++i) {
      files_.push_back({.name = "file " + std::to_string(i), .bytes = {}});
      reopen(files_.back(), O_CREAT);
    }
  }
  void reopen(ModelFile& file, int flags) {
    close(file.descriptor);
    file.descriptor = open(mounted_.at(file.name).c_str(), O_RDWR | O_CLOEXEC | flags, 0644);
    ASSERT_GE(file.descriptor, 0) << file.name << ": " << std::strerror(errno);
  }
  void growTo(ModelFile& file, std::size_t size) {
    if (file.bytes.size() < size) file.bytes.resize(size, '\0');
  }

  void read(ModelFile& file) {
    const std::size_t offset = upTo(file.bytes.size() + 100);
    const std::size_t wanted = upTo(kLongest);
    std::string bytes(wanted, '\0');
    const ssize_t count =
        pread(file.descriptor, bytes.data(), bytes.size(), static_cast<off_t>(offset));
    ASSERT_GE(count, 0) << std::strerror(errno);
    bytes.resize(static_cast<std::size_t>(count));
    const bool isInside = offset < file.bytes.size();
    const std::string expected = isInside ? file.bytes.substr(offset, wanted) : std::string();
    ASSERT_TRUE(bytes == expected) << file.name << " at " << offset;
  }
  void readAll(ModelFile& file) {
    std::string bytes(kLargest + kLongest, '\0');
    const ssize_t count = pread(file.descriptor, bytes.data(), bytes.size(), 0);
    ASSERT_EQ(count, static_cast<ssize_t>(file.bytes.size())) << file.name;
    bytes.resize(file.bytes.size());
    ASSERT_TRUE(bytes == file.bytes)
        << file.name << " differs at "
        << std::ranges::mismatch(bytes, file.bytes).in1 - bytes.begin();
  }
  void write(ModelFile& file) {
    const std::size_t offset = upTo(kLargest - kLongest);
    const std::string bytes = someBytes(upTo(kLongest));
    ASSERT_EQ(pwrite(file.descriptor, bytes.data(), bytes.size(), static_cast<off_t>(offset)),
              static_cast<ssize_t>(bytes.size()))
        << std::strerror(errno);
    if (bytes.empty()) return;
    growTo(file, offset + bytes.size());
    file.bytes.replace(offset, bytes.size(), bytes);
  }
  void truncate(ModelFile& file) {
    const std::size_t size = upTo(3) == 0 ? 0 : upTo(kLargest);
    if (upTo(1) == 0) {
      ASSERT_EQ(ftruncate(file.descriptor, static_cast<off_t>(size)), 0) << std::strerror(errno);
    } else {
      ASSERT_EQ(::truncate(mounted_.at(file.name).c_str(), static_cast<off_t>(size)), 0)
          << std::strerror(errno);
    }
    file.bytes.resize(size, '\0');
  }
  void writeThroughAMap(ModelFile& file) {
    if (file.bytes.empty()) return;
    const std::size_t size = file.bytes.size();
    void* const map = mmap(nullptr, size, PROT_READ | PROT_WRITE, MAP_SHARED, file.descriptor, 0);
    ASSERT_NE(map, MAP_FAILED) << std::strerror(errno);
    const std::size_t offset = upTo(size - 1);
    const std::string bytes = someBytes(upTo(std::min(kLongest, size - offset)));
    auto* const start = static_cast<char*>(map);
    EXPECT_TRUE(std::string(start, size) == file.bytes) << file.name << " through a map";
    std::memcpy(start + offset, bytes.data(), bytes.size());
    EXPECT_EQ(msync(map, size, MS_SYNC), 0);
    munmap(map, size);
    file.bytes.replace(offset, bytes.size(), bytes);
  }
  void makeAHole(ModelFile& file) {
    const std::size_t offset = upTo(file.bytes.size());
    const std::size_t size = upTo(kLongest) + 1;
    ASSERT_EQ(fallocate(file.descriptor, FALLOC_FL_PUNCH_HOLE | FALLOC_FL_KEEP_SIZE,
                        static_cast<off_t>(offset), static_cast<off_t>(size)),
              0)
        << std::strerror(errno);
    const std::size_t end = std::min(offset + size, file.bytes.size());
    if (offset < end) file.bytes.replace(offset, end - offset, end - offset, '\0');
  }
  void copyFromAnother(ModelFile& file) {
    ModelFile& source = anyFile();
    if (&source == &file || source.bytes.empty()) return;
    const std::size_t from = upTo(source.bytes.size() - 1);
    const std::size_t to = upTo(kLargest - kLongest);
    const std::size_t size = std::min(upTo(kLongest) + 1, source.bytes.size() - from);
    auto read = static_cast<off_t>(from);
    auto written = static_cast<off_t>(to);
    std::size_t left = size;
    while (left > 0) {
      const ssize_t count =
          copy_file_range(source.descriptor, &read, file.descriptor, &written, left, 0);
      ASSERT_GT(count, 0) << std::strerror(errno);
      left -= static_cast<std::size_t>(count);
    }
    growTo(file, to + size);
    file.bytes.replace(to, size, source.bytes, from, size);
  }
  /// Closed, since nothing is given up that is open.
  void evict(ModelFile& file) {
    close(file.descriptor);
    file.descriptor = -1;
    const std::string path = mounted_.onDisk(file.name);
    ASSERT_TRUE(eventually([&] {
      return client_.state(path).upload == ContentClient::Upload::CONFIRMED &&
             client_.evict(path) == nullptr;
    })) << file.name;
    reopen(file, 0);
  }

  void step() {
    static const std::vector<void (MountModel::*)(ModelFile&)> all{&MountModel::read,
                                                                   &MountModel::read,
                                                                   &MountModel::readAll,
                                                                   &MountModel::write,
                                                                   &MountModel::write,
                                                                   &MountModel::truncate,
                                                                   &MountModel::writeThroughAMap,
                                                                   &MountModel::makeAHole,
                                                                   &MountModel::copyFromAnother};
    if (upTo(kStepsToEviction) == 0) return evict(anyFile());
    if (upTo(20) == 0) return reopen(anyFile(), 0);
    (this->*all.at(upTo(all.size() - 1)))(anyFile());
  }

  MountedDrive mounted_;
  ContentClient client_;
  std::vector<ModelFile> files_;
  std::mt19937_64 random_;
};

TEST_F(MountModel, FilesContainWhatWasWrittenToThem) {
  const long seed = numberFrom("YOMBER_SEED", 1);
  const long steps = numberFrom("YOMBER_MOUNT_STEPS", 4000);
  std::printf("seed %ld, %ld steps\n", seed, steps);
  random_.seed(static_cast<std::uint64_t>(seed));
  makeFiles();
  for (long i = 0; i < steps && !HasFailure(); ++i) {
    SCOPED_TRACE("step " + std::to_string(i));
    step();
  }
  for (ModelFile& file : files_) {
    evict(file);
    readAll(file);
  }
}

}  // namespace
}  // namespace yomber::testing
