#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <span>

#include "platform/foundation/error.h"
#include "platform/rozzel/asset.h"

namespace yomber {

/// SHA-256 of a stream, on a thread of its own beside whoever moves the bytes.
///
/// The bytes pass in buffers that the hasher owns: take one, fill it, submit it, and go on using
/// its content until the next `buffer` call that would hand it out again (`kBuffers` later).
/// Short streams never start the thread.
///
/// Thread-safety: one thread at a time.
class StreamHasher {
 public:
  static constexpr std::size_t kBufferBytes = 1 << 20;
  static constexpr std::size_t kBuffers = 4;

  StreamHasher();
  ~StreamHasher();
  StreamHasher(const StreamHasher&) = delete;
  StreamHasher& operator=(const StreamHasher&) = delete;

  /// A buffer of kBufferBytes to fill; waits while all are being hashed.
  [[nodiscard]] std::span<std::byte> buffer();
  /// Hashes the first `count` bytes of the buffer handed out last.
  void submit(std::size_t count);
  /// Hashes bytes of the caller's at once, on the calling thread.
  void update(std::span<const std::byte> bytes);
  void updateZeros(std::uint64_t count);
  /// The hash of all that came, and how much it was. To be called once.
  [[nodiscard]] RZAsset finish();

 private:
  class Worker;
  const std::unique_ptr<Worker> worker_;
};

/// Hashes all of `source` (a regular file) from its start; its position is left alone.
[[nodiscard]] NSErrorRef rz_hashFile(int source, const RZTransfer& transfer, RZAsset& asset);

/// Copies all of `source` into `target` at the same offsets and hashes what was copied, at once.
/// Holes of the source and blocks of zeros are not written, so the target must read as zeros
/// there; its size is not set. Neither position is moved. `asset` is what was copied, even if the
/// source changed meanwhile. Failures are RZErrorDomain, or Cocoa 3072 when `transfer` cancelled.
[[nodiscard]] NSErrorRef rz_copyAndHashFile(int source, int target, const RZTransfer& transfer,
                                            RZAsset& asset);

}  // namespace yomber
