#include "platform/rozzel/stream_hasher.h"

#include <pthread.h>

#include <array>
#include <thread>

#include "platform/foundation/lock.h"
#include "platform/rozzel/sha256.h"

namespace yomber {

/// The ring: buffers hashed_..submitted_-1 wait for the hash, the next one is being filled. The
/// hash itself is the thread's while buffers wait, and the caller's while none does.
class StreamHasher::Worker {
 public:
  explicit Worker(std::size_t bufferBytes) : bufferBytes_(bufferBytes) {}
  ~Worker() {
    {
      LockGuard guard(mutex_);
      ended_ = true;
      changed_.notifyAll();
    }
    if (thread_.joinable()) thread_.join();
  }

  std::span<std::byte> buffer() {
    auto& slot = buffers_[filled_ % kBuffers];
    if (!slot) slot = std::make_unique_for_overwrite<std::byte[]>(bufferBytes_);
    waitUntilWaiting(kBuffers - 1);
    return {slot.get(), bufferBytes_};
  }

  void submit(std::size_t count) {
    const bool second = filled_ == 1;
    sizes_[filled_ % kBuffers] = count;
    ++filled_;
    {
      LockGuard guard(mutex_);
      submitted_ = filled_;
      changed_.notifyAll();
    }
    if (second) thread_ = std::thread([this] { hashSubmitted(); });
  }

  void submitZeros(std::uint64_t count) {
    drain();
    hash_.updateZeros(count);
  }

  RZAsset finish() {
    drain();
    return hash_.finish();
  }

 private:
  /// Waits until at most `count` buffers wait for the hash.
  void waitUntilWaiting(std::uint64_t count) {
    LockGuard guard(mutex_);
    while (submitted_ - hashed_ > count) changed_.wait(mutex_);
  }

  void drain() {
    if (thread_.joinable()) {
      waitUntilWaiting(0);
      return;
    }
    LockGuard guard(mutex_);
    while (hashed_ < submitted_) hashOne(hashed_++);
  }

  void hashOne(std::uint64_t index) {
    hash_.update({buffers_[index % kBuffers].get(), sizes_[index % kBuffers]});
  }

  void hashSubmitted() {
    pthread_setname_np(pthread_self(), "asset hash");
    while (true) {
      std::uint64_t next = 0;
      {
        LockGuard guard(mutex_);
        while (hashed_ == submitted_ && !ended_) changed_.wait(mutex_);
        if (hashed_ == submitted_ || ended_) return;
        next = hashed_;
      }
      hashOne(next);
      LockGuard guard(mutex_);
      ++hashed_;
      changed_.notifyAll();
    }
  }

  const std::size_t bufferBytes_;
  Mutex mutex_;
  Condition changed_;
  std::uint64_t submitted_ GUARDED_BY(mutex_) = 0;
  std::uint64_t hashed_ GUARDED_BY(mutex_) = 0;
  bool ended_ GUARDED_BY(mutex_) = false;

  // Handed over with submitted_ and hashed_.
  std::array<std::unique_ptr<std::byte[]>, kBuffers> buffers_;
  std::array<std::size_t, kBuffers> sizes_{};
  Sha256 hash_;

  // The caller's alone.
  std::uint64_t filled_ = 0;
  std::thread thread_;
};

StreamHasher::StreamHasher(std::size_t bufferBytes)
    : worker_(std::make_unique<Worker>(bufferBytes)) {}
StreamHasher::~StreamHasher() = default;
std::span<std::byte> StreamHasher::buffer() { return worker_->buffer(); }
void StreamHasher::submit(std::size_t count) { worker_->submit(count); }
void StreamHasher::submitZeros(std::uint64_t count) { worker_->submitZeros(count); }
RZAsset StreamHasher::finish() { return worker_->finish(); }

}  // namespace yomber
