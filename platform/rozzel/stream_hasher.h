#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <span>

#include "platform/rozzel/asset.h"

namespace yomber {

/// SHA-256 of a stream, on a thread of its own beside whoever moves the bytes.
///
/// Bytes pass in buffers that the hasher owns: take one with `buffer`, fill it, `submit` it. What
/// was submitted may be read (not changed) until `buffer` is called again. Streams of one buffer
/// never start the thread.
///
/// Thread-safety: one thread at a time.
class StreamHasher {
 public:
  static constexpr std::size_t kBufferBytes = 256 << 10;
  static constexpr std::size_t kBuffers = 4;

  /// Buffers may be made smaller for a stream that is known to be short.
  explicit StreamHasher(std::size_t bufferBytes = kBufferBytes);
  ~StreamHasher();
  StreamHasher(const StreamHasher&) = delete;
  StreamHasher& operator=(const StreamHasher&) = delete;

  /// A buffer to fill, the same one until it is submitted; waits while all are
  /// being hashed.
  [[nodiscard]] std::span<std::byte> buffer();
  /// Hashes the first `count` bytes of the current buffer.
  void submit(std::size_t count);
  /// Hashes so many zeros, on the calling thread.
  void submitZeros(std::uint64_t count);
  /// The hash of all that came, and how much it was. To be called once.
  [[nodiscard]] RZAsset finish();

 private:
  class Worker;
  const std::unique_ptr<Worker> worker_;
};

}  // namespace yomber
