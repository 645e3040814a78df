#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <unordered_map>
#include <vector>

#include "platform/fileprovider/enumerator.h"
#include "platform/foundation/atomic_cell.h"
#include "platform/foundation/lock.h"
#include "platform/foundation/serial_queue.h"
#include "platform/foundation/uuid.h"
#include "platform/ostrell/item_notifications.h"

namespace yomber {

/// Whether the daemon is asked to watch the whole subtree.
enum class Recursive : bool { No = false, Yes = true };

/// Lists a folder, or the root, page by page, and tells its changes.
///
/// The first listing registers the enumerator with the daemon, which pushes the folder's changes
/// from then on. They are kept in memory until the framework fetches them with a sync anchor.
/// Whenever that history cannot be trusted it is dropped and a new generation begins, whose anchors
/// the old ones are not, so that the framework lists the folder again.
///
/// Ownership: made by `initWithFileObjectID`; the framework owns it. The daemon's client library
/// and the notification centre hold it weakly, a call under way holds it until it is answered.
/// Thread-safety: every operation may be called on any thread, except where a queue is named.
class QSFileEnumerator final : public NSFileProviderChangeEnumerator,
                               public QSItemNotificationReceiving,
                               public std::enable_shared_from_this<QSFileEnumerator> {
 public:
  using ErrorCompletion = std::function<void(NSErrorRef error)>;

  /// Nil when `url` is. `fileObjectID` is nil for the root.
  static std::shared_ptr<QSFileEnumerator> initWithFileObjectID(
      QSFileObjectIDRef fileObjectID, NSURLRef url, NSFileProviderItemIdentifier itemIdentifier,
      Recursive recursive);

  // Listing: file_enumerator.cpp.

  /// Finishes the observer on the enumerator's queue or the daemon connection's.
  void enumerateItemsForObserver(NSFileProviderEnumerationObserverRef observer,
                                 NSFileProviderPage page) override;
  /// The anchor of the generation's beginning, whatever was delivered since; given at once.
  void currentSyncAnchorWithCompletionHandler(
      std::function<void(NSFileProviderSyncAnchor)> completionHandler) override;

  // Change tracking: file_enumerator_changes.cpp.

  /// Registers with the daemon unless that is done. The completion gets nil on success; it runs on
  /// the queue, or on the connection's when that fails.
  void setupNotificationReceivingIfNeededWithCompletion(ErrorCompletion completion);
  /// Finishes an expired anchor, or one without news, with the object's lock held.
  void enumerateChangesForObserver(NSFileProviderChangeObserverRef observer,
                                   NSFileProviderSyncAnchor anchor) override;
  void receiveUpdates(const QSQueryItems& items, const std::vector<std::string>& logicalExtensions,
                      const std::vector<std::string>& physicalExtensions,
                      std::function<void()> reply) override;
  /// Does nothing; the reply is never called.
  void receiveProgressUpdates(const std::vector<std::string>& identifiers,
                              std::function<void()> reply) override;
  /// For good: a later listing still lists, but registers no more.
  void invalidate() override;

  /// The list of containers changed.
  void containerListDidChange();
  /// The account changed. Waits for the queue, so it must not be called on it.
  void _accountTokenDidChange();

 private:
  using UpdatedItems = std::unordered_map<QSFileObjectIDRef, QSQueryItemRef, QSFileObjectIDHash,
                                          QSFileObjectIDEqual>;
  /// What one change request hands out.
  struct Batch {
    QSQueryItems updatedItems;
    std::vector<NSFileProviderItemIdentifier> deletedItemsIdentifiers;
    NSFileProviderSyncAnchor anchor;
  };

  QSFileEnumerator(QSFileObjectIDRef fileObjectID, NSURLRef url,
                   NSFileProviderItemIdentifier itemIdentifier, Recursive recursive);

  void _listPage(const NSFileProviderEnumerationObserverRef& observer,
                 const NSFileProviderPage& page, std::uint8_t sortOrder, std::uint64_t section);

  // On _queue (asserted).
  void _setupNotificationReceivingIfNeededWithCompletion(ErrorCompletion completion);
  void _didGetSender(const QSItemUpdateSenderRef& sender, const NSErrorRef& error,
                     const ErrorCompletion& completion);
  void _startWatching(const QSItemUpdateSenderRef& sender);
  void _startObservingAccountChangesIfNeeded();
  void _stopObservingAccountChanges();
  void _invalidate();

  void _handleNotificationError(NSErrorRef error);
  /// A handler that takes errors to `_handleNotificationError` and does not keep the enumerator
  /// alive.
  ErrorCompletion _notificationErrorHandler();
  void _observe(const std::string& notification, void (QSFileEnumerator::*handler)());
  void _invalidateChangeToken();
  void _signalChange();
  void _collect(const QSQueryItemRef& item) REQUIRES(_lock);
  /// The batch that follows `anchor`; finishes the observer and answers nothing when there is none.
  std::optional<Batch> _takeBatchOrFinish(const NSFileProviderChangeObserverRef& observer,
                                          const NSFileProviderSyncAnchor& anchor) REQUIRES(_lock);

  const NSFileProviderItemIdentifier _itemIdentifier;
  const QSFileObjectIDRef _fileObjectID;
  const NSURLRef _url;
  const Recursive _isRecursive;
  const std::shared_ptr<SerialQueue> _queue;

  // The lock of the object itself. Taken again by `_invalidateChangeToken`.
  RecursiveMutex _lock;
  UpdatedItems _updatedItemsByIDs GUARDED_BY(_lock);
  std::vector<NSFileProviderItemIdentifier> _deletedItemsIdentifiers GUARDED_BY(_lock);
  std::uint64_t _rank GUARDED_BY(_lock) = 0;
  /// Written under the lock; the current anchor reads it without.
  AtomicCell<UUID> _uuid;

  // On _queue. `_invalidate` writes these two under the lock as well.
  QSItemUpdateSenderRef _remoteNotificationSender;
  bool _invalidated = false;
  // On _queue.
  bool _isObservingAccountChanges = false;
  /// Set on _queue, cleared on whichever thread the registration ends.
  std::atomic<bool> _isSettingUpNotificationReceiving{false};
};

}  // namespace yomber
