#include "platform/fileprovider/thumbnail_sender.h"

#include <chrono>
#include <iterator>
#include <utility>

#include "platform/ipc/call.h"

namespace yomber {
namespace {

constexpr int kMaximumCalls = 2;
constexpr std::size_t kMaximumBytesWaiting = std::size_t{4} << 20U;
constexpr std::size_t kBytesInCall = std::size_t{1} << 20U;
constexpr std::size_t kThumbnailsInCall = 256;
/// What a thumbnail takes besides its image.
constexpr std::size_t kOverhead = 256;

std::size_t bytesOf(const ItemThumbnail& thumbnail) {
  return kOverhead + (thumbnail.image != nullptr ? thumbnail.image->length() : 0);
}

NSErrorRef tooLarge(std::size_t length) {
  return NSError::errorWithDomain(
      NSCocoaErrorDomain, NSFileReadCorruptFileError,
      {{NSLocalizedDescriptionKey,
        "the thumbnail has " + std::to_string(length) + " bytes, more than any that is shown"}});
}

}  // namespace

void ThumbnailSender::deliver(ItemThumbnail thumbnail) {
  if (thumbnail.image != nullptr && thumbnail.image->length() > kMaximumThumbnailBytes) {
    thumbnail.error = tooLarge(thumbnail.image->length());
    thumbnail.image = nullptr;
  }
  {
    LockGuard guard(mutex_);
    while (!isEnded_ && bytes_ >= kMaximumBytesWaiting) room_.wait(mutex_);
    if (isEnded_) return;
    bytes_ += bytesOf(thumbnail);
    waiting_.push_back(std::move(thumbnail));
  }
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
  Thumbnails dropped;
  std::function<void(NSErrorRef)> handler;
  LockGuard guard(mutex_);
  isEnded_ = true;
  dropped.swap(waiting_);
  handler.swap(handler_);
  room_.notifyAll();
}

ThumbnailSender::Thumbnails ThumbnailSender::takePart(std::size_t& bytes) {
  std::size_t count = 0;
  while (count < waiting_.size() && count < kThumbnailsInCall && bytes < kBytesInCall) {
    bytes += bytesOf(waiting_[count++]);
  }
  const auto end = waiting_.begin() + static_cast<std::ptrdiff_t>(count);
  Thumbnails part(std::make_move_iterator(waiting_.begin()), std::make_move_iterator(end));
  waiting_.erase(waiting_.begin(), end);
  return part;
}

std::function<void(NSErrorRef)> ThumbnailSender::takeHandler() {
  const bool isDue = calls_ == 0 && waiting_.empty();
  return isDue ? std::exchange(handler_, nullptr) : nullptr;
}

void ThumbnailSender::sendWhatWaits() {
  for (;;) {
    std::size_t bytes = 0;
    std::shared_ptr<const Thumbnails> part;
    {
      LockGuard guard(mutex_);
      if (isEnded_ || waiting_.empty() || calls_ == kMaximumCalls) return;
      ++calls_;
      part = std::make_shared<const Thumbnails>(takePart(bytes));
    }
    send(std::move(part), bytes);
  }
}

void ThumbnailSender::send(std::shared_ptr<const Thumbnails> part, std::size_t bytes) {
  using Receiver = protocol::ThumbnailReceiver;
  (void)ipc::call(
      receiver_, &Receiver::Client::didFetchRequest,
      [part = std::move(part)](Receiver::DidFetchParams::Builder params) {
        auto list = params.initThumbnails(static_cast<unsigned>(part->size()));
        for (unsigned i = 0; i < list.size(); ++i) encodeThumbnail((*part)[i], list[i]);
      },
      [self = shared_from_this(), bytes](NSErrorRef error, const auto*) {
        self->didSend(bytes, std::move(error));
      },
      // A receiver may take its time; when it goes, the request is dropped.
      {.timeout = std::chrono::milliseconds::zero()});
}

void ThumbnailSender::didSend(std::size_t bytes, NSErrorRef error) {
  std::function<void(NSErrorRef)> due;
  NSErrorRef failure;
  Thumbnails dropped;
  {
    LockGuard guard(mutex_);
    --calls_;
    bytes_ -= bytes;
    if (error != nullptr) {
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
