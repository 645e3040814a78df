#include "platform/ostrell/item_update_sender.h"

#include <algorithm>
#include <utility>

#include "platform/fileprovider/item_codec.h"
#include "platform/ipc/error_codec.h"
#include "platform/ostrell/constants.h"
#include "platform/ostrell/daemon_wire.h"

namespace yomber {
namespace {

NSErrorRef connectionLost(const NSErrorRef& reason) {
  return NSError::errorWithDomain(
      QSOstrellErrorDomain, QSOstrellErrorConnectionLost,
      {{NSUnderlyingErrorKey, reason},
       {NSLocalizedDescriptionKey, std::string("the connection to the daemon was lost")}});
}

NSErrorRef wasInvalidated() {
  return NSError::errorWithDomain(
      QSOstrellErrorDomain, QSOstrellErrorConnectionLost,
      {{NSLocalizedDescriptionKey, std::string("the subscription was invalidated")}});
}

/// A sender, or a proxy of one. `slot` is empty for the sender as it was replied.
class ItemUpdateSender final : public QSItemUpdateSender {
 public:
  ItemUpdateSender(std::shared_ptr<ItemSubscription> subscription,
                   std::shared_ptr<ErrorHandlerSlot> slot)
      : subscription_(std::move(subscription)), slot_(std::move(slot)) {}

  void boostPriority(std::function<void()> completion) override;
  void watchItemAtURL(const NSURLRef& url, std::uint32_t options,
                      std::function<void(NSErrorRef)> gatherReply) override;
  void invalidate() override;
  std::shared_ptr<QSItemUpdateSender> remoteObjectProxyWithErrorHandler(
      std::function<void(NSErrorRef)> errorHandler) override {
    return std::make_shared<ItemUpdateSender>(subscription_,
                                              subscription_->addHandler(std::move(errorHandler)));
  }

 private:
  /// Calls the daemon's end; a transport failure, also of a call that cannot be made, fails this
  /// proxy. `deliver(results)` runs on the loop thread.
  template <typename Params, typename Results, typename Fill, typename Deliver>
  void call(ipc::RequestMethod<protocol::ItemSender::Client, Params, Results> method, Fill fill,
            Deliver deliver);

  const std::shared_ptr<ItemSubscription> subscription_;
  const std::shared_ptr<ErrorHandlerSlot> slot_;
};

template <typename Params, typename Results, typename Fill, typename Deliver>
void ItemUpdateSender::call(
    ipc::RequestMethod<protocol::ItemSender::Client, Params, Results> method, Fill fill,
    Deliver deliver) {
  NSErrorRef error;
  const auto remote = subscription_->remote(&error);
  if (!remote) {
    if (slot_) slot_->fail(error);
    return;
  }
  using Reader = typename Results::Reader;
  auto onReply = [slot = slot_, deliver = std::move(deliver)](NSErrorRef failure,
                                                              const Reader* results) {
    if (results != nullptr) failure = whatIsWrongWith([&] { deliver(*results); });
    if (failure && slot) slot->fail(connectionLost(failure));
  };
  (void)ipc::call(remote, method, std::move(fill), std::move(onReply),
                  subscription_->callOptions());
}

void ItemUpdateSender::boostPriority(std::function<void()> completion) {
  call(
      &protocol::ItemSender::Client::boostPriorityRequest, [](auto) {},
      [completion = std::move(completion), queue = subscription_->queue()](const auto&) {
        if (completion) queue->async(completion);
      });
}

void ItemUpdateSender::watchItemAtURL(const NSURLRef& url, std::uint32_t options,
                                      std::function<void(NSErrorRef)> gatherReply) {
  const auto& queue = subscription_->queue();
  if (!url) {
    if (!gatherReply) return;
    queue->async([gatherReply = std::move(gatherReply)] {
      gatherReply(NSError::errorWithDomain(NSCocoaErrorDomain, NSFileNoSuchFileError));
    });
    return;
  }
  call(
      &protocol::ItemSender::Client::watchItemRequest,
      [path = url->path(), options](protocol::ItemSender::WatchItemParams::Builder params) {
        params.setPath(wireData(path));
        params.setOptions(options);
      },
      [gatherReply = std::move(gatherReply), queue](const auto& results) {
        if (!gatherReply) return;
        queue->async([gatherReply, failure = ipc::decodeOptional(results.getFailure())] {
          gatherReply(failure);
        });
      });
}

void ItemUpdateSender::invalidate() {
  const auto remote = subscription_->remote(nullptr);
  if (!remote) return;
  // The daemon hears of it also by losing its last reference; the call says so at once.
  (void)ipc::call(
      remote, &protocol::ItemSender::Client::invalidateRequest, [](auto) {},
      [](const NSErrorRef&, const auto*) {}, subscription_->callOptions());
  subscription_->invalidate();
}

/// Says that a batch was taken in. Also when it is dropped: a receiver that forgot it, or went
/// away, must not stop the daemon.
class UpdatesReply {
 public:
  explicit UpdatesReply(kj::Own<kj::PromiseFulfiller<void>> fulfiller)
      : fulfiller_(std::move(fulfiller)) {}
  UpdatesReply(const UpdatesReply&) = delete;
  UpdatesReply& operator=(const UpdatesReply&) = delete;
  ~UpdatesReply() { send(); }

  void send() {
    if (isSent_.exchange(true)) return;
    ipc::EventLoop::shared().post(
        [fulfiller = std::move(fulfiller_)]() mutable { fulfiller->fulfill(); });
  }

 private:
  std::atomic<bool> isSent_ = false;
  kj::Own<kj::PromiseFulfiller<void>> fulfiller_;
};

std::vector<std::string> decodeStrings(capnp::List<capnp::Text>::Reader reader) {
  std::vector<std::string> strings;
  strings.reserve(reader.size());
  for (const auto each : reader) strings.push_back(stringFromWire(each));
  return strings;
}

class ItemReceiverServer final : public protocol::ItemReceiver::Server {
 public:
  ItemReceiverServer(const std::shared_ptr<QSItemNotificationReceiving>& receiver,
                     const std::shared_ptr<ItemSubscription>& subscription)
      : receiver_(receiver), subscription_(subscription), queue_(subscription->queue()) {}

  kj::Promise<void> receiveUpdates(ReceiveUpdatesContext context) override;
  kj::Promise<void> receiveProgressUpdates(ReceiveProgressUpdatesContext context) override;
  kj::Promise<void> senderDidFail(SenderDidFailContext context) override {
    const auto error = ipc::decodeError(context.getParams().getError());
    if (const auto subscription = subscription_.lock()) subscription->fail(error);
    return kj::READY_NOW;
  }

 private:
  const std::weak_ptr<QSItemNotificationReceiving> receiver_;
  const std::weak_ptr<ItemSubscription> subscription_;
  const std::shared_ptr<SerialQueue> queue_;
};

kj::Promise<void> ItemReceiverServer::receiveUpdates(ReceiveUpdatesContext context) {
  auto params = context.getParams();
  auto items = decodeQueryItems(params.getItems());
  auto logical = decodeStrings(params.getLogicalExtensions());
  auto physical = decodeStrings(params.getPhysicalExtensions());
  context.releaseParams();
  auto pair = kj::newPromiseAndFulfiller<void>();
  auto reply = std::make_shared<UpdatesReply>(kj::mv(pair.fulfiller));
  queue_->async([weak = receiver_, weakSubscription = subscription_, items = std::move(items),
                 logical = std::move(logical), physical = std::move(physical),
                 reply = std::move(reply)] {
    if (const auto receiver = weak.lock()) {
      receiver->receiveUpdates(items, logical, physical, [reply] { reply->send(); });
    } else if (const auto subscription = weakSubscription.lock()) {
      subscription->invalidate();
    }
  });
  return kj::mv(pair.promise);
}

kj::Promise<void> ItemReceiverServer::receiveProgressUpdates(
    ReceiveProgressUpdatesContext context) {
  auto identifiers = decodeStrings(context.getParams().getIdentifiers());
  context.releaseParams();
  // The daemon drops this call at once; nobody waits for an answer.
  context.allowCancellation();
  queue_->async([weak = receiver_, identifiers = std::move(identifiers)] {
    if (const auto receiver = weak.lock()) receiver->receiveProgressUpdates(identifiers, [] {});
  });
  return kj::NEVER_DONE;
}

}  // namespace

// ---- ItemSubscription --------------------------------------------------------------------------

void ItemSubscription::begin(DaemonSessionRef session, ipc::Remote<protocol::ItemSender> remote) {
  LockGuard guard(mutex_);
  if (failure_) return;
  session_ = std::move(session);
  remote_ = std::move(remote);
}

void ItemSubscription::fail(const NSErrorRef& error) {
  const auto reported = error->domain() == QSOstrellErrorDomain ? error : connectionLost(error);
  std::vector<std::weak_ptr<ErrorHandlerSlot>> handlers;
  DaemonSessionRef session;
  ipc::Remote<protocol::ItemSender> remote;
  {
    LockGuard guard(mutex_);
    if (failure_) return;
    failure_ = reported;
    handlers.swap(handlers_);
    std::swap(session, session_);
    std::swap(remote, remote_);
  }
  for (const auto& each : handlers) {
    if (const auto slot = each.lock()) slot->fail(reported);
  }
}

void ItemSubscription::invalidate() {
  DaemonSessionRef session;
  ipc::Remote<protocol::ItemSender> remote;
  LockGuard guard(mutex_);
  if (failure_) return;
  failure_ = wasInvalidated();
  isInvalidated_ = true;
  handlers_.clear();
  std::swap(session, session_);
  std::swap(remote, remote_);
}

std::shared_ptr<ErrorHandlerSlot> ItemSubscription::addHandler(
    std::function<void(NSErrorRef)> handler) {
  auto slot = std::make_shared<ErrorHandlerSlot>(std::move(handler), queue_);
  NSErrorRef failure;
  {
    LockGuard guard(mutex_);
    if (handlers_.size() >= nextSweep_) {
      std::erase_if(handlers_, [](const auto& each) { return each.expired(); });
      nextSweep_ = std::max<std::size_t>(8, handlers_.size() * 2);
    }
    if (!failure_) handlers_.push_back(slot);
    if (!isInvalidated_) failure = failure_;
  }
  if (failure) slot->fail(failure);
  return slot;
}

ipc::Remote<protocol::ItemSender> ItemSubscription::remote(NSErrorRef* error) const {
  LockGuard guard(mutex_);
  if (!remote_) storeError(error, failure_);
  return remote_;
}

QSItemUpdateSenderRef makeItemUpdateSender(const std::shared_ptr<ItemSubscription>& subscription) {
  return std::make_shared<ItemUpdateSender>(subscription, nullptr);
}

protocol::ItemReceiver::Client makeItemReceiver(
    const std::shared_ptr<QSItemNotificationReceiving>& receiver,
    const std::shared_ptr<ItemSubscription>& subscription) {
  return kj::heap<ItemReceiverServer>(receiver, subscription);
}

}  // namespace yomber
