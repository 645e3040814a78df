#include "zarn/item_sender_server.h"

#include <utility>

#include "platform/fileprovider/item_codec.h"
#include "platform/foundation/lock.h"
#include "platform/ipc/call.h"
#include "platform/ipc/error_codec.h"
#include "platform/ipc/server_call.h"
#include "platform/ostrell/constants.h"
#include "zarn/daemon_errors.h"
#include "zarn/item_encoder.h"

namespace yomber {

namespace {

using Receiver = protocol::ItemReceiver;

constexpr std::size_t kMaximumWatches = 64;  // of one subscription

/// Hands over to a receiver in another process.
class RemoteReceiver final : public WatchReceiver {
 public:
  explicit RemoteReceiver(ipc::Remote<Receiver> remote) : remote_(std::move(remote)) {}
  ~RemoteReceiver() override { cancel(); }

  void receive(std::vector<WatchedChange> changes, std::function<void(bool)> answered) override {
    const auto fill = [changes = std::move(changes)](auto params) {
      auto items = params.initItems(static_cast<unsigned>(changes.size()));
      for (unsigned i = 0; i < items.size(); ++i) encode(changes[i], items[i]);
    };
    const std::uint64_t number = begin();
    // A receiver may take as long as it likes: what waits for it is bounded.
    auto call = ipc::call(remote_, &Receiver::Client::receiveUpdatesRequest, fill,
                          [answered = std::move(answered)](const NSErrorRef& error, const auto*) {
                            answered(error == nullptr);
                          },
                          {.timeout = std::chrono::milliseconds(0)});
    keep(std::move(call), number);
  }

  void fail(NSErrorRef error) override {
    cancel();
    (void)ipc::call(
        remote_, &Receiver::Client::senderDidFailRequest,
        [error](auto params) { ipc::encodeError(error, params.initError()); },
        [](const NSErrorRef&, const auto*) {});
  }

  void cancel() {
    ipc::CallHandle call;
    {
      LockGuard guard(mutex_);
      std::swap(call_, call);
    }
    call.cancel();
  }

 private:
  static void encode(const WatchedChange& change, protocol::Item::Builder item) {
    if (change.isDeletion) {
      encodeDeadItem(change.row->id, change.row->kind, item);
    } else {
      encodeRow(*change.row, item);
    }
  }

  std::uint64_t begin() {
    LockGuard guard(mutex_);
    return ++begun_;
  }
  /// Unless it was answered meanwhile and the next is under way already: the answer may come, on
  /// another thread, before the call is kept.
  void keep(ipc::CallHandle call, std::uint64_t number) {
    LockGuard guard(mutex_);
    if (number == begun_) std::swap(call_, call);
  }

  const ipc::Remote<Receiver> remote_;
  Mutex mutex_;
  ipc::CallHandle call_ GUARDED_BY(mutex_);
  std::uint64_t begun_ GUARDED_BY(mutex_) = 0;
};

void answer(const NSErrorRef& error, protocol::OptionalError::Builder failure) {
  ipc::encodeOptional(error, failure);
}

}  // namespace

ItemSenderServer::ItemSenderServer(std::shared_ptr<Drive> drive, ipc::Remote<Receiver> receiver)
    : drive_(std::move(drive)),
      subscription_(
          drive_->watchers->subscribe(std::make_shared<RemoteReceiver>(std::move(receiver)))) {}

ItemSenderServer::~ItemSenderServer() { subscription_->close(); }

kj::Promise<void> ItemSenderServer::boostPriority(BoostPriorityContext) {
  // Every watcher is told at once: there is nothing to put first.
  return kj::READY_NOW;
}

kj::Promise<void> ItemSenderServer::invalidate(InvalidateContext) {
  subscription_->close();
  return kj::READY_NOW;
}

kj::Promise<void> ItemSenderServer::watchItem(WatchItemContext context) {
  const auto params = context.getParams();
  const std::uint32_t options = params.getOptions();
  std::string path = stringFromWire(params.getPath());
  context.releaseParams();
  NSErrorRef error = drive_->accountError();
  if (!error && !areValidWatchOptions(options)) {
    error = invalidParameterError("options", std::to_string(options));
  }
  if (!error && ++watches_ > kMaximumWatches) error = invalidParameterError("path", path);
  if (!error && path == drive_->layout.root()) error = subscription_->watch(kRootID, options);
  if (error || path == drive_->layout.root()) {
    answer(error, context.getResults().initFailure());
    return kj::READY_NOW;
  }
  if (drive_->firstScan->isOpen()) return watchFolderAt(context, std::move(path), options);
  context.allowCancellation();
  return drive_->firstScan->wait().then(
      [this, context, options, path = std::move(path)](NSErrorRef failure) mutable {
        if (!failure) return watchFolderAt(context, std::move(path), options);
        answer(failure, context.getResults().initFailure());
        return kj::Promise<void>(kj::READY_NOW);
      });
}

/// Looked up right here, so that the watch is active before any later call of the connection.
kj::Promise<void> ItemSenderServer::watchFolderAt(WatchItemContext context, std::string path,
                                                  std::uint32_t options) {
  const auto row = drive_->store->itemAtPath(path);
  if (!row) return scanAndWatch(context, std::move(path), options);
  answer(watchRow(*row, path, options), context.getResults().initFailure());
  return kj::READY_NOW;
}

/// A folder that nobody can know by id yet: what a listing shows comes later anyway.
kj::Promise<void> ItemSenderServer::scanAndWatch(WatchItemContext context, std::string path,
                                                 std::uint32_t options) {
  context.allowCancellation();
  struct Found {
    std::optional<ItemRow> row;
    NSErrorRef error;
  };
  return ipc::onPool([drive = drive_, path](const ipc::CancelFlag&) {
           Found found;
           found.row = drive->scanner->scanLocation(path, &found.error);
           return found;
         })
      .then([this, context, path, options](Found found) mutable {
        if (!found.row && !found.error) found.error = noSuchLocationError(path);
        answer(found.row ? watchRow(*found.row, path, options) : found.error,
               context.getResults().initFailure());
      });
}

NSErrorRef ItemSenderServer::watchRow(const ItemRow& row, const std::string& path,
                                      std::uint32_t options) {
  if (!row.isFolder()) return NSError::errorWithErrno(ENOTDIR, path);
  return subscription_->watch(row.id, options);
}

}  // namespace yomber
