// A disk with a write cache that forgets: volatile_disk BACKING MOUNTPOINT shows one file, "disk",
// of the size of BACKING. What is written to it stays in memory until it is synced; then it is
// written to BACKING. For tests that cut the power of a file system on it (by way of a loop
// device). Prints "ready" when it can be used. Ends when it is unmounted.
//
// Words written to the second file, "control":
//
//   cut SEED PERCENT   the power goes: of the blocks that were not synced, each survives with that
//                      probability; from then on everything fails with EIO
//   revive             the disk can be used again
//
// Reading "control" tells "waiting N survived N lost N": blocks that wait for a sync now, and what
// came of those of the last cut.
#define FUSE_USE_VERSION 31

#include <fcntl.h>
#include <fuse.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <csignal>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <map>
#include <random>
#include <sstream>
#include <string>
#include <string_view>
#include <vector>

#include "platform/foundation/lock.h"

namespace yomber::testing {
namespace {

constexpr std::size_t kBlock = 4096;
using Block = std::array<char, kBlock>;

/// The disk and its cache. Thread-safety: every operation may be called on any thread.
class VolatileDisk {
 public:
  bool open(const char* backing) {
    descriptor_ = ::open(backing, O_RDWR | O_CLOEXEC);
    struct stat status{};
    if (descriptor_ < 0 || fstat(descriptor_, &status) != 0) return false;
    size_ = static_cast<std::uint64_t>(status.st_size) / kBlock * kBlock;
    return size_ > 0;
  }
  [[nodiscard]] std::uint64_t size() const { return size_; }

  int read(char* into, std::size_t length, std::uint64_t offset) {
    LockGuard guard(mutex_);
    if (isCut_) return -EIO;
    for (const Piece& piece : pieces(length, offset)) {
      Block bytes;
      if (!load(piece.block, bytes)) return -EIO;
      std::memcpy(into + piece.done, bytes.data() + piece.begin, piece.length);
    }
    return bytesFrom(length, offset);
  }
  int write(const char* from, std::size_t length, std::uint64_t offset) {
    LockGuard guard(mutex_);
    if (isCut_) return -EIO;
    for (const Piece& piece : pieces(length, offset)) {
      Block bytes;
      if (!load(piece.block, bytes)) return -EIO;
      std::memcpy(bytes.data() + piece.begin, from + piece.done, piece.length);
      cache_[piece.block] = bytes;
    }
    return bytesFrom(length, offset);
  }
  int sync() {
    LockGuard guard(mutex_);
    if (isCut_) return -EIO;
    for (const auto& [block, bytes] : cache_) {
      if (!store(block, bytes)) return -EIO;
    }
    cache_.clear();
    return 0;
  }

  /// False when the words make no sense.
  bool command(const std::string& words) {
    LockGuard guard(mutex_);
    std::istringstream input(words);
    std::string verb;
    input >> verb;
    if (verb == "revive") {
      isCut_ = false;
      return true;
    }
    std::uint64_t seed = 0;
    unsigned percent = 0;
    if (verb != "cut" || !(input >> seed >> percent)) return false;
    cut(seed, percent);
    return true;
  }
  std::string statistics() {
    LockGuard guard(mutex_);
    return "waiting " + std::to_string(cache_.size()) + " survived " + std::to_string(survived_) +
           " lost " + std::to_string(lost_) + "\n";
  }

 private:
  /// A part of a request that lies in one block.
  struct Piece {
    std::uint64_t block = 0;
    std::size_t begin = 0;  ///< in the block
    std::size_t done = 0;   ///< of the request before it
    std::size_t length = 0;
  };
  [[nodiscard]] int bytesFrom(std::size_t length, std::uint64_t offset) const {
    if (offset >= size_) return 0;
    return static_cast<int>(std::min<std::uint64_t>(length, size_ - offset));
  }
  [[nodiscard]] std::vector<Piece> pieces(std::size_t length, std::uint64_t offset) const {
    std::vector<Piece> result;
    const auto all = static_cast<std::size_t>(bytesFrom(length, offset));
    for (std::size_t done = 0; done < all; done += result.back().length) {
      const std::size_t begin = (offset + done) % kBlock;
      result.push_back({.block = (offset + done) / kBlock,
                        .begin = begin,
                        .done = done,
                        .length = std::min(all - done, kBlock - begin)});
    }
    return result;
  }
  bool load(std::uint64_t block, Block& bytes) REQUIRES(mutex_) {
    const auto cached = cache_.find(block);
    if (cached == cache_.end()) {
      return pread(descriptor_, bytes.data(), kBlock, static_cast<off_t>(block * kBlock)) == kBlock;
    }
    bytes = cached->second;
    return true;
  }
  bool store(std::uint64_t block, const Block& bytes) const {
    return pwrite(descriptor_, bytes.data(), kBlock, static_cast<off_t>(block * kBlock)) == kBlock;
  }
  void cut(std::uint64_t seed, unsigned percent) REQUIRES(mutex_) {
    std::mt19937_64 random(seed);
    survived_ = 0;
    lost_ = 0;
    for (const auto& [block, bytes] : cache_) {
      const bool survives = random() % 100 < percent && store(block, bytes);
      ++(survives ? survived_ : lost_);
    }
    cache_.clear();
    isCut_ = true;
  }

  int descriptor_ = -1;
  std::uint64_t size_ = 0;
  Mutex mutex_;
  std::map<std::uint64_t, Block> cache_ GUARDED_BY(mutex_);
  bool isCut_ GUARDED_BY(mutex_) = false;
  std::uint64_t survived_ GUARDED_BY(mutex_) = 0;
  std::uint64_t lost_ GUARDED_BY(mutex_) = 0;
};

VolatileDisk& disk() {
  static auto* const shared = new VolatileDisk;
  return *shared;
}

constexpr std::string_view kDisk = "/disk";
constexpr std::string_view kControl = "/control";

int getAttributes(const char* path, struct stat* status, fuse_file_info*) {
  *status = {};
  if (std::string_view(path) == "/") {
    status->st_mode = S_IFDIR | 0700;
    status->st_nlink = 2;
  } else if (path == kDisk || path == kControl) {
    status->st_mode = S_IFREG | 0600;
    status->st_nlink = 1;
    status->st_size = path == kDisk ? static_cast<off_t>(disk().size()) : 0;
  } else {
    return -ENOENT;
  }
  return 0;
}

int openFile(const char* path, fuse_file_info* info) {
  if (path != kDisk && path != kControl) return -ENOENT;
  info->direct_io = 1;  // the cache that counts is ours
  return 0;
}

int readFile(const char* path, char* into, std::size_t length, off_t offset, fuse_file_info*) {
  const auto begin = static_cast<std::uint64_t>(offset);
  if (path == kDisk) return disk().read(into, length, begin);
  const std::string text = disk().statistics();
  if (begin >= text.size()) return 0;
  return static_cast<int>(text.copy(into, length, begin));
}

int writeFile(const char* path, const char* from, std::size_t length, off_t offset,
              fuse_file_info*) {
  if (path == kDisk) return disk().write(from, length, static_cast<std::uint64_t>(offset));
  return disk().command(std::string(from, length)) ? static_cast<int>(length) : -EINVAL;
}

int truncateFile(const char* path, off_t, fuse_file_info*) { return path == kControl ? 0 : -EPERM; }

int syncFile(const char* path, int, fuse_file_info*) { return path == kDisk ? disk().sync() : 0; }

void* announce(fuse_conn_info*, fuse_config*) {
  (void)std::puts("ready");
  (void)std::fflush(stdout);
  return nullptr;
}

int serve(char* program, char* mountPoint) {
  fuse_operations operations{};
  operations.getattr = getAttributes;
  operations.open = openFile;
  operations.read = readFile;
  operations.write = writeFile;
  operations.truncate = truncateFile;
  operations.fsync = syncFile;
  operations.init = announce;
  std::string foreground = "-f";
  std::array<char*, 3> arguments{program, foreground.data(), mountPoint};
  return fuse_main(arguments.size(), arguments.data(), &operations, nullptr);
}

}  // namespace
}  // namespace yomber::testing

int main(int argc, char** argv) {
  if (argc != 3 || !yomber::testing::disk().open(argv[1])) {
    (void)std::fprintf(stderr, "usage: volatile_disk BACKING MOUNTPOINT\n");
    return 64;
  }
  (void)prctl(PR_SET_PDEATHSIG, SIGKILL);  // no test leaves it behind
  return yomber::testing::serve(argv[0], argv[2]);
}
