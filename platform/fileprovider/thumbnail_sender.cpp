#include "platform/fileprovider/thumbnail_sender.h"

#include <chrono>
#include <utility>

#include "platform/ipc/call.h"

namespace yomber {
namespace {

constexpr int kMaximumCalls = 2;
constexpr std::size_t kMaximumBytesWaiting = std::size_t{4} << 20U;
constexpr std::size_t kBytesInCall = std::size_t{1} << 20U;
constexpr std::size_t kThumbnailsInCall = 256;
/// Of the files that have been read, so many are kept, and none that a large image has made large.
constexpr std::size_t kFilesKept = 3;
constexpr std::size_t kBytesInKeptFile = 2 * kBytesInCall;

bool isFull(const ThumbnailBatch& batch) {
  return batch.size() == kThumbnailsInCall || batch.bytes() >= kBytesInCall;
}

}  // namespace

void ThumbnailSender::deliver(ItemThumbnail thumbnail) {
  ThumbnailBatch batch;
  {
    LockGuard guard(mutex_);
    while (!isEnded_ && bytes_ >= kMaximumBytesWaiting) room_.wait(mutex_);
    if (isEnded_) return;
    batch = takeUnfilled();
  }
  const std::size_t before = batch.bytes();
  batch.add(std::move(thumbnail));
  const std::size_t added = batch.bytes() - before;
  didFill(std::move(batch), added);
}

ThumbnailBatch ThumbnailSender::takeUnfilled() {
  ++filling_;
  if (!waiting_.empty() && !isFull(waiting_.back())) {
    ThumbnailBatch batch = std::move(waiting_.back());
    waiting_.pop_back();
    return batch;
  }
  if (read_.empty()) return ThumbnailBatch();
  ImageFile file = std::move(read_.back());
  read_.pop_back();
  file.clear();
  return ThumbnailBatch(std::move(file));
}

void ThumbnailSender::didFill(ThumbnailBatch batch, std::size_t added) {
  std::function<void(NSErrorRef)> due;
  NSErrorRef failure;
  {
    LockGuard guard(mutex_);
    --filling_;
    if (!isEnded_) {
      bytes_ += added;
      waiting_.push_back(std::move(batch));
    }
    due = takeHandler();
    failure = failure_;
  }
  if (due) return due(failure);
  sendWhatWaits();
}

void ThumbnailSender::finish(std::function<void(NSErrorRef)> handler) {
  std::function<void(NSErrorRef)> due;
  NSErrorRef failure;
  {
    LockGuard guard(mutex_);
    handler_ = std::move(handler);
    due = takeHandler();
    failure = failure_;
  }
  if (due) due(failure);
}

void ThumbnailSender::end() {
  std::deque<ThumbnailBatch> dropped;
  std::function<void(NSErrorRef)> handler;
  LockGuard guard(mutex_);
  isEnded_ = true;
  dropped.swap(waiting_);
  handler.swap(handler_);
  room_.notifyAll();
}

std::function<void(NSErrorRef)> ThumbnailSender::takeHandler() {
  const bool isDue = calls_ == 0 && filling_ == 0 && waiting_.empty();
  return isDue ? std::exchange(handler_, nullptr) : nullptr;
}

void ThumbnailSender::sendWhatWaits() {
  for (;;) {
    std::shared_ptr<const ThumbnailBatch> batch;
    {
      LockGuard guard(mutex_);
      if (isEnded_ || waiting_.empty() || calls_ == kMaximumCalls) return;
      ++calls_;
      batch = std::make_shared<const ThumbnailBatch>(std::move(waiting_.front()));
      waiting_.pop_front();
    }
    send(std::move(batch));
  }
}

void ThumbnailSender::send(std::shared_ptr<const ThumbnailBatch> batch) {
  using Receiver = protocol::ThumbnailReceiver;
  (void)ipc::call(
      receiver_, &Receiver::Client::didFetchRequest,
      [batch](Receiver::DidFetchParams::Builder params) { batch->encode(params); },
      [self = shared_from_this(), batch](NSErrorRef error, const auto*) {
        self->didSend(*batch, std::move(error));
      },
      // A receiver may take its time; when it goes, the request is dropped.
      {.timeout = std::chrono::milliseconds::zero()});
}

void ThumbnailSender::keepForReuse(const ImageFile& file) {
  const bool isWorthIt =
      file.exists() && file.length() <= kBytesInKeptFile && read_.size() < kFilesKept;
  if (isWorthIt) read_.push_back(file);
}

void ThumbnailSender::didSend(const ThumbnailBatch& batch, NSErrorRef error) {
  std::function<void(NSErrorRef)> due;
  NSErrorRef failure;
  std::deque<ThumbnailBatch> dropped;
  {
    LockGuard guard(mutex_);
    --calls_;
    bytes_ -= batch.bytes();
    if (error == nullptr) {
      keepForReuse(batch.images());
    } else {
      if (failure_ == nullptr) failure_ = std::move(error);
      isEnded_ = true;
      dropped.swap(waiting_);
    }
    due = takeHandler();
    failure = failure_;
    room_.notifyAll();
  }
  if (due) return due(failure);
  sendWhatWaits();
}

}  // namespace yomber
