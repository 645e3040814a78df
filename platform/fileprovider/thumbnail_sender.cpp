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

}  // namespace

void ThumbnailSender::deliver(ItemThumbnail thumbnail) {
  {
    LockGuard guard(mutex_);
    while (!isEnded_ && bytes_ >= kMaximumBytesWaiting) room_.wait(mutex_);
    if (isEnded_) return;
    add(std::move(thumbnail));
  }
  sendWhatWaits();
}

void ThumbnailSender::add(ItemThumbnail thumbnail) {
  const auto isFull = [](const ThumbnailBatch& batch) {
    return batch.size() == kThumbnailsInCall || batch.bytes() >= kBytesInCall;
  };
  if (waiting_.empty() || isFull(waiting_.back())) waiting_.emplace_back(takeFile());
  ThumbnailBatch& batch = waiting_.back();
  bytes_ -= batch.bytes();
  batch.add(std::move(thumbnail));
  bytes_ += batch.bytes();
}

ImageFile ThumbnailSender::takeFile() {
  if (read_.empty()) return {};
  ImageFile file = std::move(read_.back());
  read_.pop_back();
  file.clear();
  return file;
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
  const bool isDue = calls_ == 0 && waiting_.empty();
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

void ThumbnailSender::didSend(const ThumbnailBatch& batch, NSErrorRef error) {
  std::function<void(NSErrorRef)> due;
  NSErrorRef failure;
  std::deque<ThumbnailBatch> dropped;
  {
    LockGuard guard(mutex_);
    --calls_;
    bytes_ -= batch.bytes();
    if (error == nullptr) {
      // An answer says that the images have been read.
      if (batch.images().exists()) read_.push_back(batch.images());
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
