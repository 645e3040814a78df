#include "platform/rozzel/following_hasher.h"

#include <pthread.h>

#include <algorithm>
#include <cstddef>
#include <optional>
#include <thread>

#include "platform/foundation/fault_points.h"
#include "platform/foundation/lock.h"
#include "platform/rozzel/sha256.h"
#include "platform/rozzel/sparse_file.h"
#include "platform/rozzel/store_failure.h"

namespace yomber {
namespace {

/// Small enough to stay in the cache of the processor that hashes it.
constexpr std::size_t kPiece = 128 << 10;

FaultPoint whenFollowing("rozzel.copy.followed");

}  // namespace

/// The hash itself is the thread's while bytes wait for it, and the caller's while none do.
class FollowingHasher::Worker {
 public:
  explicit Worker(int file)
      : file_(file), piece_(std::make_unique_for_overwrite<std::byte[]>(kPiece)) {}
  ~Worker() {
    {
      LockGuard guard(mutex_);
      isEnding_ = true;
      changed_.notifyAll();
    }
    if (thread_.joinable()) thread_.join();
  }

  void wrote(std::uint64_t count) {
    {
      LockGuard guard(mutex_);
      written_ += count;
      changed_.notifyAll();
    }
    if (!thread_.joinable()) thread_ = std::thread([this] { follow(); });
    keepLead();
  }

  void skipped(std::uint64_t count) {
    waitUntilLeft(0);
    hash_.updateZeros(count);
    LockGuard guard(mutex_);
    written_ += count;
    hashed_ += count;
  }

  RZAsset finish() {
    waitUntilLeft(0);
    LockGuard guard(mutex_);
    if (failure_) throw StoreFailure{failure_};
    return hash_.finish();
  }

 private:
  /// Waits until at most `count` bytes wait for the hash.
  void waitUntilLeft(std::uint64_t count) {
    LockGuard guard(mutex_);
    wait(count);
  }
  /// Once the hash is too far behind, it catches up by half: to be woken for each piece would cost
  /// both threads more than the hash.
  void keepLead() {
    LockGuard guard(mutex_);
    if (written_ - hashed_ > kLead) wait(kLead / 2);
  }
  void wait(std::uint64_t count) REQUIRES(mutex_) {
    awaited_ = count;
    while (written_ - hashed_ > count) changed_.wait(mutex_);
    awaited_ = 0;
  }

  void follow() {
    pthread_setname_np(pthread_self(), "asset hash");
    while (const auto next = nextPiece()) {
      (void)whenFollowing.hit();
      NSErrorRef failure = catchingFailures([&] { hashPiece(next->offset, next->length); });
      LockGuard guard(mutex_);
      hashed_ += next->length;
      if (failure && !failure_) failure_ = std::move(failure);
      if (written_ - hashed_ <= awaited_) changed_.notifyAll();
    }
  }

  struct Piece {
    std::uint64_t offset = 0;
    std::size_t length = 0;
  };
  /// Waits for it; nothing at the end.
  std::optional<Piece> nextPiece() {
    LockGuard guard(mutex_);
    while (hashed_ == written_ && !isEnding_) changed_.wait(mutex_);
    if (isEnding_) return std::nullopt;
    return Piece{hashed_,
                 static_cast<std::size_t>(std::min<std::uint64_t>(written_ - hashed_, kPiece))};
  }

  void hashPiece(std::uint64_t offset, std::size_t length) {
    const std::span<std::byte> bytes(piece_.get(), length);
    const std::size_t count = readFully(file_, bytes, offset);
    hash_.update(bytes.first(count));
    hash_.updateZeros(length - count);
  }

  const int file_;
  Mutex mutex_;
  Condition changed_;
  std::uint64_t written_ GUARDED_BY(mutex_) = 0;
  std::uint64_t hashed_ GUARDED_BY(mutex_) = 0;
  std::uint64_t awaited_ GUARDED_BY(mutex_) = 0;  ///< the writer waits until so many are left
  NSErrorRef failure_ GUARDED_BY(mutex_);
  bool isEnding_ GUARDED_BY(mutex_) = false;

  // Handed over with written_ and hashed_.
  Sha256 hash_;

  const std::unique_ptr<std::byte[]> piece_;  // the thread's
  std::thread thread_;                        // the caller's
};

FollowingHasher::FollowingHasher(int file) : worker_(std::make_unique<Worker>(file)) {}
FollowingHasher::~FollowingHasher() = default;
void FollowingHasher::wrote(std::uint64_t count) { worker_->wrote(count); }
void FollowingHasher::skipped(std::uint64_t count) { worker_->skipped(count); }
RZAsset FollowingHasher::finish() { return worker_->finish(); }

}  // namespace yomber
