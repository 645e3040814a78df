#pragma once

#include <cstddef>
#include <deque>
#include <functional>
#include <memory>
#include <vector>

#include "platform/fileprovider/thumbnail_batch.h"
#include "platform/foundation/lock.h"
#include "platform/ipc/remote.h"

namespace yomber {

/// Tells a receiver of thumbnails as they come, several at a time, with at most two calls under
/// way. Whoever delivers faster than the receiver takes is held up.
///
/// Ownership: shared; kept by its calls under way.
/// Thread-safety: every operation may be called on any thread; `deliver` may block, so not on the
/// loop thread.
class ThumbnailSender : public std::enable_shared_from_this<ThumbnailSender> {
 public:
  explicit ThumbnailSender(ipc::Remote<protocol::ThumbnailReceiver> receiver)
      : receiver_(std::move(receiver)) {}

  /// Returns when there is room for the next one. After the end, or a failure of the receiver,
  /// nothing is sent any more. An image that is too large becomes an error.
  void deliver(ItemThumbnail thumbnail);
  /// Calls `handler` once, when everything that was delivered has been taken: with nil, or with why
  /// the receiver took no more. Nothing is delivered after it.
  void finish(std::function<void(NSErrorRef)> handler);
  /// Nobody waits any more: lets everybody go.
  void end();

 private:
  /// The batch that is to be filled, which nobody else has meanwhile.
  [[nodiscard]] ThumbnailBatch takeUnfilled() REQUIRES(mutex_);
  void didFill(ThumbnailBatch batch, std::size_t added);
  void sendWhatWaits();
  void send(std::shared_ptr<const ThumbnailBatch> batch);
  void didSend(const ThumbnailBatch& batch, NSErrorRef error);
  void keepForReuse(const ImageFile& file) REQUIRES(mutex_);
  /// The handler, when it is due.
  [[nodiscard]] std::function<void(NSErrorRef)> takeHandler() REQUIRES(mutex_);

  const ipc::Remote<protocol::ThumbnailReceiver> receiver_;

  Mutex mutex_;
  Condition room_;
  std::deque<ThumbnailBatch> waiting_ GUARDED_BY(mutex_);  ///< a call each
  std::vector<ImageFile> read_ GUARDED_BY(mutex_);         ///< to be used again: memory costs time
  std::size_t bytes_ GUARDED_BY(mutex_) = 0;               ///< that wait or are under way
  int filling_ GUARDED_BY(mutex_) = 0;                     ///< batches that are taken to be filled
  int calls_ GUARDED_BY(mutex_) = 0;                       ///< under way
  bool isEnded_ GUARDED_BY(mutex_) = false;
  NSErrorRef failure_ GUARDED_BY(mutex_);
  std::function<void(NSErrorRef)> handler_ GUARDED_BY(mutex_);
};

}  // namespace yomber
