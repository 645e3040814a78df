#include "platform/fileprovider/thumbnail_taker.h"

#include <utility>

#include "platform/fileprovider/thumbnail_batch.h"
#include "platform/foundation/lock.h"
#include "platform/foundation/serial_queue.h"
#include "platform/ipc/server_call.h"

namespace yomber {

class ThumbnailTaker::State {
 public:
  State(const std::string& queueName, Take take)
      : queue(SerialQueue::create(queueName)), take_(std::move(take)) {}

  void take(const ThumbnailBatch& batch) {
    LockGuard guard(mutex_);
    if (!take_) return;
    for (std::size_t i = 0; i < batch.size(); ++i) take_(batch.at(i));
  }
  void end() {
    LockGuard guard(mutex_);
    take_ = nullptr;
  }

  const std::shared_ptr<SerialQueue> queue;

 private:
  Mutex mutex_;  ///< held while the thumbnails are taken
  Take take_ GUARDED_BY(mutex_);
};

class ThumbnailTaker::Receiver final : public protocol::ThumbnailReceiver::Server {
 public:
  explicit Receiver(std::shared_ptr<State> state) : state_(std::move(state)) {}

 protected:
  kj::Promise<void> didFetch(DidFetchContext context) override {
    auto decoded = ThumbnailBatch::decode(context.getParams());
    context.releaseParams();
    return decoded.then([state = state_](ThumbnailBatch batch) {
      return ipc::onQueue(state->queue, [state, batch = std::move(batch)](const ipc::CancelFlag&) {
        state->take(batch);
      });
    });
  }

 private:
  const std::shared_ptr<State> state_;
};

ThumbnailTaker::ThumbnailTaker(const std::string& queueName, Take take)
    : state_(std::make_shared<State>(queueName, std::move(take))) {}

ThumbnailTaker::~ThumbnailTaker() { state_->end(); }

protocol::ThumbnailReceiver::Client ThumbnailTaker::receiver() const {
  return kj::heap<Receiver>(state_);
}

}  // namespace yomber
