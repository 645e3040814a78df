#pragma once

#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/fileprovider/extension.h"
#include "platform/foundation/lock.h"
#include "platform/foundation/operation.h"
#include "platform/foundation/serial_queue.h"
#include "platform/ostrell/query_item.h"

namespace yomber {

/// Whether a bookmark's location is replaced by its target's.
enum class ResolveAliases : bool { No = false, Yes = true };
/// Whether the location that is answered is marked as naming the physical file.
enum class AttachPhysical : bool { No = false, Yes = true };

/// The drive's extension: turns each request of the framework into calls on the daemon's client
/// library, and results and errors back into the framework's terms. It keeps no items and no
/// account: every request asks afresh.
///
/// Ownership: made by `init`; the notification centre holds it weakly.
/// Thread-safety: every operation may be called on any thread, concurrently. The lookups block
/// their thread for the daemon's replies. Errors: each `error` may be null and is written only on
/// failure.
class QSFileProviderExtension final : public NSFileProviderExtension {
 public:
  /// Never nil. From now on an account change signals the root's enumerator.
  static std::shared_ptr<QSFileProviderExtension> init();
  ~QSFileProviderExtension() override;

  /// Calls the handler at once; no placeholder file is written.
  void providePlaceholderAtURL(const NSURLRef& url, ErrorHandler completionHandler) override;

  // Lookup: item_lookup.cpp.

  /// The item's location, or nil: bookmarks resolved, no physical mark.
  NSURLRef URLForItemWithPersistentIdentifier(
      const NSFileProviderItemIdentifier& identifier) override;
  NSURLRef _URLForItemWithPersistentIdentifier(const NSFileProviderItemIdentifier& identifier,
                                               ResolveAliases resolvingQSAliases);
  NSURLRef _URLForItemWithPersistentIdentifier(const NSFileProviderItemIdentifier& identifier,
                                               ResolveAliases resolvingQSAliases,
                                               AttachPhysical attachPhysical);
  std::optional<NSFileProviderItemIdentifier> persistentIdentifierForItemAtURL(
      const NSURLRef& url) override;
  /// Nobody being signed in is NSFileProviderErrorNotAuthenticated.
  NSFileProviderItemRef itemForIdentifier(const NSFileProviderItemIdentifier& identifier,
                                          NSErrorRef* error = nullptr) override;
  /// For what the extension has itself just made or moved: the daemon scans it before it answers.
  QSQueryItemRef _propertiesForNewItemAtURL(const NSURLRef& url, NSErrorRef* error);
  QSQueryItemRef _propertiesForItemAtURL(const NSURLRef& url, NSErrorRef* error);
  QSQueryItemRef _propertiesForItemAtURL(const NSURLRef& url, ForceScan forceScan,
                                         NSErrorRef* error);

  // Enumeration: enumerator_selection.cpp.

  /// A new enumerator of the container. Nobody being signed in is
  /// NSFileProviderErrorNotAuthenticated.
  NSFileProviderEnumeratorRef enumeratorForContainerItemIdentifier(
      const NSFileProviderItemIdentifier& identifier, NSErrorRef* error = nullptr) override;

  // The account.

  /// The gate that lookups by identifier and enumerators pass: whether somebody is signed in.
  bool _isLoggedInOrError(NSErrorRef* error);
  /// Signals the root's enumerator, and nothing else.
  void _accountDidChange();

 private:
  QSFileProviderExtension();

  // "The lock of the object itself", and that of the array. Never hold both at once, nor either
  // while calling out.
  RecursiveMutex _lock;
  RecursiveMutex _itemsForcedDownloadLock;

  // In this order: they are released from the last to the first.

  /// The downloads in flight, by the item's path.
  std::map<std::string, std::shared_ptr<NSOperation>> _downloadOperationByPath GUARDED_BY(_lock);
  std::shared_ptr<NSOperationQueue> _operationQueue;
  /// Part of the object's footprint; nothing is submitted to it.
  std::shared_ptr<SerialQueue> _queue;
  /// The items whose download was forced so that they could be renamed or moved.
  std::vector<std::string> _itemsForcedDownload GUARDED_BY(_itemsForcedDownloadLock);
};

}  // namespace yomber
