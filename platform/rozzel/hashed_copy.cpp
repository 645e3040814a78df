#include "platform/rozzel/hashed_copy.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <limits>
#include <optional>

#include "platform/rozzel/sparse_file.h"
#include "platform/rozzel/store_failure.h"
#include "platform/rozzel/stream_hasher.h"

namespace yomber {

namespace {

constexpr std::uint64_t kZeroStep = 64 << 20;

/// One pass over a file: what is data goes through the hasher's buffers, holes are only counted.
class HashingPass {
 public:
  HashingPass(int source, std::optional<int> target, const RZTransfer& transfer)
      : source_(source), target_(target), transfer_(transfer) {}

  RZAsset run() {
    struct stat status{};
    if (fstat(source_, &status) != 0) throwErrno("cannot examine the content");
    const auto size = static_cast<std::uint64_t>(status.st_size);
    if (size > StreamHasher::kBufferBytes) {
      posix_fadvise(source_, 0, 0, POSIX_FADV_SEQUENTIAL);
    }
    // One byte more tells that the file has grown.
    hasher_.emplace(
        static_cast<std::size_t>(std::min<std::uint64_t>(size + 1, StreamHasher::kBufferBytes)));
    if (static_cast<std::uint64_t>(status.st_blocks) * 512 < size) {
      passSparse();
    } else {
      passData(std::numeric_limits<std::uint64_t>::max());
    }
    return hasher_->finish();
  }

 private:
  void passSparse() {
    while (true) {
      const off_t data = lseek(source_, static_cast<off_t>(offset_), SEEK_DATA);
      if (data < 0 && errno != ENXIO) throwErrno("cannot look for the holes of the content");
      if (data < 0) break;
      passHole(static_cast<std::uint64_t>(data));
      const off_t hole = lseek(source_, data, SEEK_HOLE);
      if (hole < 0) break;  // cut short meanwhile
      if (!passData(static_cast<std::uint64_t>(hole))) return;
    }
    struct stat status{};
    if (fstat(source_, &status) != 0) throwErrno("cannot examine the content");
    passHole(static_cast<std::uint64_t>(status.st_size));
  }

  void passHole(std::uint64_t end) {
    while (offset_ < end) {
      const std::uint64_t step = std::min(end - offset_, kZeroStep);
      hasher_->submitZeros(step);
      advance(step);
    }
  }

  /// False at the end of the file.
  bool passData(std::uint64_t end) {
    while (offset_ < end) {
      const auto buffer = hasher_->buffer();
      const auto wanted =
          static_cast<std::size_t>(std::min<std::uint64_t>(buffer.size(), end - offset_));
      const std::size_t count = readFully(source_, buffer.first(wanted), offset_);
      if (count == 0) return false;
      hasher_->submit(count);
      if (target_) writeSparsely(*target_, buffer.first(count), offset_);
      advance(count);
      if (count < wanted) return false;
    }
    return true;
  }

  void advance(std::uint64_t count) {
    offset_ += count;
    if (transfer_.progress && !transfer_.progress(offset_)) throwCancelled();
  }

  const int source_;
  const std::optional<int> target_;
  const RZTransfer& transfer_;
  std::optional<StreamHasher> hasher_;
  std::uint64_t offset_ = 0;
};

}  // namespace

NSErrorRef rz_hashFile(int source, const RZTransfer& transfer, RZAsset& asset) {
  return catchingFailures([&] { asset = HashingPass(source, std::nullopt, transfer).run(); });
}

NSErrorRef rz_copyAndHashFile(int source, int target, const RZTransfer& transfer, RZAsset& asset) {
  return catchingFailures([&] { asset = HashingPass(source, target, transfer).run(); });
}

}  // namespace yomber
