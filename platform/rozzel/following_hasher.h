#pragma once

#include <cstdint>
#include <memory>

#include "platform/rozzel/asset.h"

namespace yomber {

/// SHA-256 of a file while it is written, on a thread of its own that reads what was written a
/// little earlier: the very bytes that the file has, still in the cache.
///
/// Thread-safety: one thread at a time.
class FollowingHasher {
 public:
  /// How far the writer may be ahead.
  static constexpr std::uint64_t kLead = 8 << 20;

  /// `file` must be open for reading, and stay open as long as this.
  explicit FollowingHasher(int file);
  ~FollowingHasher();
  FollowingHasher(const FollowingHasher&) = delete;
  FollowingHasher& operator=(const FollowingHasher&) = delete;

  /// The next `count` bytes have been written; past the file's end they count as zeros. Waits while
  /// too many are to be hashed.
  void wrote(std::uint64_t count);
  /// The next `count` bytes are a hole, which is not read.
  void skipped(std::uint64_t count);
  /// The hash of all of them, and how many they were. To be called once. Throws StoreFailure when
  /// the file could not be read.
  [[nodiscard]] RZAsset finish();

 private:
  class Worker;
  const std::unique_ptr<Worker> worker_;
};

}  // namespace yomber
