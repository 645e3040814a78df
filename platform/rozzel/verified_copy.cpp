#include "platform/rozzel/verified_copy.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <memory>
#include <span>

#include "platform/rozzel/following_hasher.h"
#include "platform/rozzel/sparse_file.h"
#include "platform/rozzel/store_failure.h"

namespace yomber {
namespace {

/// Progress is told of so often.
constexpr std::uint64_t kStep = 1 << 20;
constexpr std::size_t kBuffer = 128 << 10;

class VerifiedCopy {
 public:
  VerifiedCopy(int source, int target, const RZTransfer& transfer)
      : source_(source), target_(target), transfer_(transfer), hasher_(target) {}

  RZAsset run() {
    posix_fadvise(source_, 0, 0, POSIX_FADV_SEQUENTIAL);
    const std::uint64_t size = sizeOfSource();
    while (offset_ < size) {
      const off_t data = lseek(source_, static_cast<off_t>(offset_), SEEK_DATA);
      if (data < 0 && errno != ENXIO) throwErrno("cannot look for the holes of the content");
      skipTo(data < 0 ? size : static_cast<std::uint64_t>(data));
      if (data < 0) break;
      const off_t hole = lseek(source_, data, SEEK_HOLE);
      if (hole < 0 || !copyTo(static_cast<std::uint64_t>(hole))) break;  // cut short meanwhile
    }
    return hasher_.finish();
  }

 private:
  [[nodiscard]] std::uint64_t sizeOfSource() const {
    struct stat status{};
    if (fstat(source_, &status) != 0) throwErrno("cannot examine the content");
    return static_cast<std::uint64_t>(status.st_size);
  }

  void skipTo(std::uint64_t end) {
    constexpr std::uint64_t kHoleStep = 64 << 20;
    while (offset_ < end) {
      const std::uint64_t count = std::min(end - offset_, kHoleStep);
      hasher_.skipped(count);
      advance(count);
    }
  }

  /// False at the end of the file.
  bool copyTo(std::uint64_t end) {
    while (offset_ < end) {
      const std::uint64_t wanted = std::min(end - offset_, kStep);
      std::uint64_t count = copyInKernel(wanted);
      if (count == 0) count = copyThroughBuffer(wanted);
      if (count == 0) return false;
      hasher_.wrote(count);
      advance(count);
    }
    return true;
  }

  /// 0 when it cannot, for whatever reason: doing it ourselves tells.
  std::uint64_t copyInKernel(std::uint64_t wanted) {
    if (!isForKernel_) return 0;
    auto from = static_cast<off_t>(offset_);
    off_t to = from;
    ssize_t count = 0;
    do {
      count = copy_file_range(source_, &from, target_, &to, wanted, 0);
    } while (count < 0 && errno == EINTR);
    isForKernel_ = count > 0;
    return isForKernel_ ? static_cast<std::uint64_t>(count) : 0;
  }

  std::uint64_t copyThroughBuffer(std::uint64_t wanted) {
    if (!buffer_) buffer_ = std::make_unique_for_overwrite<std::byte[]>(kBuffer);
    const auto length = static_cast<std::size_t>(std::min<std::uint64_t>(wanted, kBuffer));
    const std::span<std::byte> bytes(buffer_.get(), length);
    const std::size_t count = readFully(source_, bytes, offset_);
    writeSparsely(target_, bytes.first(count), offset_);
    return count;
  }

  void advance(std::uint64_t count) {
    offset_ += count;
    if (transfer_.progress && !transfer_.progress(offset_)) throwCancelled();
  }

  const int source_;
  const int target_;
  const RZTransfer& transfer_;
  FollowingHasher hasher_;
  std::unique_ptr<std::byte[]> buffer_;
  bool isForKernel_ = true;
  std::uint64_t offset_ = 0;
};

}  // namespace

NSErrorRef rz_copyAndHashTarget(int source, int target, const RZTransfer& transfer,
                                RZAsset& asset) {
  return catchingFailures([&] { asset = VerifiedCopy(source, target, transfer).run(); });
}

}  // namespace yomber
