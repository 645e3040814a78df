#include "platform/fileprovider/manager.h"
#include "platform/foundation/log.h"
#include "platform/foundation/notification_center.h"
#include "platform/ostrell/constants.h"
#include "platform/ostrell/container.h"
#include "platform/ostrell/daemon_connection.h"
#include "platform/ostrell/errors.h"
#include "provider/enumeration/change_tokens.h"
#include "provider/enumeration/file_enumerator.h"
#include "provider/extension/log_sections.h"

namespace yomber {
namespace {

/// So many pending entries drop the history.
constexpr std::size_t kPendingEntriesThatDropTheHistory = 5001;

/// Bits that the daemon defines; the recursive ones add the bit of value 4.
constexpr std::uint32_t kWatchOptions = 19;
constexpr std::uint32_t kRecursiveWatchOptions = 23;

}  // namespace

// ---- Registration ------------------------------------------------------------------------------

void QSFileEnumerator::setupNotificationReceivingIfNeededWithCompletion(
    ErrorCompletion completion) {
  _queue->async([self = shared_from_this(), completion = std::move(completion)] {
    self->_setupNotificationReceivingIfNeededWithCompletion(completion);
  });
}

void QSFileEnumerator::_setupNotificationReceivingIfNeededWithCompletion(
    ErrorCompletion completion) {
  _queue->assertOnQueue();
  _startObservingAccountChangesIfNeeded();
  if (_isSettingUpNotificationReceiving) {
    log_fault(qsc_default_log(), "[CRIT] Assertion failed: !_isSettingUpNotificationReceiving");
  }
  _isSettingUpNotificationReceiving = true;
  const auto self = shared_from_this();
  const ErrorCompletion wrapper = [self, completion = std::move(completion)](NSErrorRef error) {
    self->_isSettingUpNotificationReceiving = false;
    if (completion) completion(std::move(error));
  };
  if (_remoteNotificationSender != nullptr) {
    wrapper(nullptr);
    return;
  }
  const QSDaemonProxyRef proxy =
      QSDaemonConnection::defaultConnection().remoteObjectProxyWithErrorHandler(wrapper);
  proxy->getItemUpdateSenderWithReceiver(
      self, [self, wrapper](QSItemUpdateSenderRef sender,
                            const std::map<std::string, std::string>& /*info*/, NSErrorRef error) {
        self->_queue->async([self, wrapper, sender = std::move(sender), error = std::move(error)] {
          self->_didGetSender(sender, error, wrapper);
        });
      });
}

void QSFileEnumerator::_didGetSender(const QSItemUpdateSenderRef& sender, const NSErrorRef& error,
                                     const ErrorCompletion& completion) {
  if (error != nullptr) {
    completion(error);
    return;
  }
  if (sender != nullptr) {
    if (_invalidated) {
      sender->invalidate();
    } else {
      _startWatching(sender);
    }
  }
  completion(nullptr);
}

void QSFileEnumerator::_startWatching(const QSItemUpdateSenderRef& sender) {
  _remoteNotificationSender =
      sender->remoteObjectProxyWithErrorHandler(_notificationErrorHandler());
  _remoteNotificationSender->boostPriority([] {});
  const std::uint32_t options =
      _isRecursive == Recursive::Yes ? kRecursiveWatchOptions : kWatchOptions;
  sender->remoteObjectProxyWithErrorHandler(_notificationErrorHandler())
      ->watchItemAtURL(_url, options, [handler = _notificationErrorHandler()](NSErrorRef error) {
        if (error != nullptr) handler(std::move(error));
      });
}

QSFileEnumerator::ErrorCompletion QSFileEnumerator::_notificationErrorHandler() {
  return [weakSelf = weak_from_this()](NSErrorRef error) {
    if (const auto self = weakSelf.lock()) self->_handleNotificationError(std::move(error));
  };
}

void QSFileEnumerator::invalidate() {
  _queue->async([self = shared_from_this()] { self->_invalidate(); });
}

void QSFileEnumerator::_invalidate() {
  _queue->assertOnQueue();
  {
    LockGuard guard(_lock);
    _invalidated = true;
    if (_remoteNotificationSender != nullptr) _remoteNotificationSender->invalidate();
    _remoteNotificationSender = nullptr;
  }
  _stopObservingAccountChanges();
}

// ---- What drops the history --------------------------------------------------------------------

void QSFileEnumerator::_startObservingAccountChangesIfNeeded() {
  _queue->assertOnQueue();
  if (_isObservingAccountChanges || _invalidated) return;
  _isObservingAccountChanges = true;
  _observe(QSAccountTokenDidChangeNotification, &QSFileEnumerator::_accountTokenDidChange);
  if (_itemIdentifier == NSFileProviderRootContainerItemIdentifier) {
    // For its effect: the library starts to observe the list.
    (void)QSContainer::allContainers();
    _observe(QSContainerListDidChangeNotification, &QSFileEnumerator::containerListDidChange);
  }
}

void QSFileEnumerator::_stopObservingAccountChanges() {
  _queue->assertOnQueue();
  _isObservingAccountChanges = false;
  NSNotificationCenter::defaultCenter().removeObserver(this);
}

void QSFileEnumerator::_observe(const std::string& notification,
                                void (QSFileEnumerator::*handler)()) {
  NSNotificationCenter::defaultCenter().addObserver(shared_from_this(), notification,
                                                    [weakSelf = weak_from_this(), handler] {
                                                      if (const auto self = weakSelf.lock())
                                                        ((*self).*handler)();
                                                    });
}

void QSFileEnumerator::containerListDidChange() {
  const LogSection section(LogSectionLevel::Debug);
  log_debug(qsc_default_log(),
            "[DEBUG] ┏%llx container list did change, invalidating our change token", section.id());
  _invalidateChangeToken();
  _signalChange();
}

void QSFileEnumerator::_accountTokenDidChange() {
  log_default(qsc_default_log(),
              "[NOTICE] received account did update notification, invalidating change token");
  _queue->sync([this] {
    // A live sender says by itself when its history ends.
    if (_remoteNotificationSender != nullptr) return;
    _invalidateChangeToken();
    _signalChange();
  });
}

void QSFileEnumerator::_handleNotificationError(NSErrorRef error) {
  _queue->async([self = shared_from_this(), error = std::move(error)] {
    log_debug(qsc_default_log(), "[DEBUG] There was an error while fetching items: %@", error);
    self->_remoteNotificationSender = nullptr;
    self->_invalidateChangeToken();
    if (error != nullptr && error->domain() == QSOstrellErrorDomain) self->_signalChange();
  });
}

void QSFileEnumerator::_invalidateChangeToken() {
  log_debug(qsc_default_log(), "[DEBUG] invalidating change token");
  LockGuard guard(_lock);
  _deletedItemsIdentifiers.clear();
  _updatedItemsByIDs.clear();
  _rank = 0;
  UUID uuid;
  uuid_generate(uuid);
  _uuid.store(uuid);
}

void QSFileEnumerator::_signalChange() {
  log_debug(qsc_default_log(), "[DEBUG] signal changes to fileproviderd");
  NSFileProviderManager::defaultManager().signalEnumeratorForContainerItemIdentifier(
      _itemIdentifier, [](const NSErrorRef& error) {
        if (error == nullptr) return;
        log_error(qsc_default_log(), "[ERROR] failed to signal enumerator for root container: %@",
                  error);
      });
}

// ---- Collecting and handing out ----------------------------------------------------------------

void QSFileEnumerator::receiveUpdates(const QSQueryItems& items,
                                      const std::vector<std::string>& /*logicalExtensions*/,
                                      const std::vector<std::string>& /*physicalExtensions*/,
                                      std::function<void()> reply) {
  {
    LockGuard guard(_lock);
    for (const QSQueryItemRef& item : items) _collect(item);
    const std::size_t pending = _updatedItemsByIDs.size() + _deletedItemsIdentifiers.size();
    if (pending >= kPendingEntriesThatDropTheHistory) _invalidateChangeToken();
  }
  _signalChange();
  if (reply) reply();
}

void QSFileEnumerator::_collect(const QSQueryItemRef& item) {
  const QSFileObjectIDRef& fileObjectID = item->fileObjectID();
  // The root has no id, and is nobody's child.
  if (fileObjectID == nullptr) return;
  if (item->isDead()) {
    _updatedItemsByIDs.erase(fileObjectID);
    _deletedItemsIdentifiers.push_back(fileObjectID->asString());
  } else {
    std::erase(_deletedItemsIdentifiers, fileObjectID->asString());
    _updatedItemsByIDs[fileObjectID] = item;
  }
}

void QSFileEnumerator::receiveProgressUpdates(const std::vector<std::string>& /*identifiers*/,
                                              std::function<void()> /*reply*/) {}

void QSFileEnumerator::enumerateChangesForObserver(NSFileProviderChangeObserverRef observer,
                                                   NSFileProviderSyncAnchor anchor) {
  const LogSection section(LogSectionLevel::Debug);
  log_debug(qsc_default_log(), "[DEBUG] ┏%llx listing changes", section.id());
  std::optional<Batch> batch;
  {
    LockGuard guard(_lock);
    batch = _takeBatchOrFinish(observer, anchor);
  }
  if (!batch) return;
  observer->didUpdateItems(fileProviderItems(batch->updatedItems));
  observer->didDeleteItemsWithIdentifiers(batch->deletedItemsIdentifiers);
  observer->finishEnumeratingChangesUpToSyncAnchor(batch->anchor, false);
}

std::optional<QSFileEnumerator::Batch> QSFileEnumerator::_takeBatchOrFinish(
    const NSFileProviderChangeObserverRef& observer, const NSFileProviderSyncAnchor& anchor) {
  Log& log = qsc_default_log();
  const UUID uuid = _uuid.load();
  const auto rank = static_cast<std::int64_t>(qs_changeTokenRankWithUUID(anchor, uuid));
  log_debug(log, "[DEBUG] requested rank: %lld", rank);
  if (rank < 0 || static_cast<std::uint64_t>(rank) != _rank) {
    log_debug(log, "[DEBUG] token expired (current rank %llu)", _rank);
    observer->finishEnumeratingWithError(
        NSError::errorWithDomain(NSFileProviderErrorDomain, NSFileProviderErrorSyncAnchorExpired));
    _invalidateChangeToken();
    return std::nullopt;
  }
  if (_updatedItemsByIDs.empty() && _deletedItemsIdentifiers.empty()) {
    log_debug(log, "[DEBUG] no update to send back");
    observer->finishEnumeratingChangesUpToSyncAnchor(anchor, false);
    return std::nullopt;
  }
  Batch batch;
  batch.updatedItems.reserve(_updatedItemsByIDs.size());
  for (const auto& [fileObjectID, item] : _updatedItemsByIDs) batch.updatedItems.push_back(item);
  _updatedItemsByIDs.clear();
  batch.deletedItemsIdentifiers.swap(_deletedItemsIdentifiers);
  ++_rank;
  batch.anchor = qs_changeTokenFromRank(_rank, uuid);
  return batch;
}

}  // namespace yomber
