#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/fileprovider/extension.h"
#include "platform/foundation/data.h"
#include "platform/foundation/date.h"
#include "platform/foundation/lock.h"
#include "platform/foundation/operation.h"
#include "platform/foundation/serial_queue.h"
#include "platform/ostrell/container.h"
#include "platform/ostrell/file_object_id.h"
#include "platform/ostrell/file_providing_operation.h"
#include "platform/ostrell/query_item.h"
#include "platform/rozzel/identifiers.h"
#include "platform/rozzel/record.h"

namespace yomber {

class RZContainer;
class RZFetchRecordsOperation;

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
/// failure. Completion handlers may be empty, unless it is said otherwise, and are called once.
class QSFileProviderExtension : public NSFileProviderExtension,
                                public std::enable_shared_from_this<QSFileProviderExtension> {
 public:
  /// Never nil. From now on an account change signals the root's enumerator.
  static std::shared_ptr<QSFileProviderExtension> init();
  ~QSFileProviderExtension() override;

  /// Calls the handler at once; no placeholder file is written.
  void providePlaceholderAtURL(const NSURLRef& url, ErrorHandler completionHandler) override;

  // Content: providing.cpp and stopping.cpp.

  /// Reads outside the synced tree, and of what is here already, are granted at once. Everything
  /// else is provided by an operation that `stopProvidingItemAtURL` can cancel.
  void startProvidingItemAtURL(const NSURLRef& url, ErrorHandler completionHandler) override;
  void startProvidingItemAtURL(const NSURLRef& url, NSFileCoordinatorReadingOptions readingOptions,
                               ErrorHandler completionHandler) override;
  /// Cancels the item's providing operation, or gives up its local content; neither for what is
  /// being downloaded so that it can be moved.
  void stopProvidingItemAtURL(const NSURLRef& url) override;
  void itemChangedAtURL(const NSURLRef& url) override;
  /// Answers on the calling thread.
  void movingItemAtURL(const NSURLRef& url, const NSURLRef& destinationURL,
                       MoveHandler completionHandler) override;

  // Changes of the tree: import.cpp, rename_and_reparent.cpp and trash.cpp. They return before the
  // work is done, but for trashing, which answers on the calling thread.

  /// An import whose item cannot be looked up answers neither item nor error.
  void importDocumentAtURL(const NSURLRef& url,
                           const NSFileProviderItemIdentifier& toParentItemIdentifier,
                           ItemHandler completionHandler) override;
  void createDirectoryWithName(const std::string& name,
                               const NSFileProviderItemIdentifier& inParentItemIdentifier,
                               ItemHandler completionHandler) override;
  void renameItemWithIdentifier(const NSFileProviderItemIdentifier& identifier,
                                const std::string& toName, ItemHandler completionHandler) override;
  /// A move that needs the content downloads it first, and keeps it until the move has begun.
  void reparentItemWithIdentifier(const NSFileProviderItemIdentifier& identifier,
                                  const NSFileProviderItemIdentifier& toParentItemWithIdentifier,
                                  const std::optional<std::string>& newName,
                                  ItemHandler completionHandler) override;
  /// Answers errors as they come, not in the framework's terms.
  void trashItemWithIdentifier(const NSFileProviderItemIdentifier& identifier,
                               ItemHandler completionHandler) override;
  void _trashItemAtURLWithoutCoordination(const NSURLRef& url,
                                          URLHandler completionHandler) override;
  void untrashItemWithIdentifier(
      const NSFileProviderItemIdentifier& identifier,
      const std::optional<NSFileProviderItemIdentifier>& toParentItemIdentifier,
      ItemHandler completionHandler) override;
  void deleteItemWithIdentifier(const NSFileProviderItemIdentifier& identifier,
                                ErrorHandler completionHandler) override;

  // Metadata: item_metadata.cpp. They answer on the calling thread.

  void setLastUsedDate(const std::optional<NSDate>& date,
                       const NSFileProviderItemIdentifier& forItemIdentifier,
                       ItemHandler completionHandler) override;
  /// REQUIRES: a completion handler. Tags land on a bookmark's target.
  void setTagData(const NSDataRef& tagData, const NSFileProviderItemIdentifier& forItemIdentifier,
                  ItemHandler completionHandler) override;
  void setFavoriteRank(const std::optional<std::int64_t>& rank,
                       const NSFileProviderItemIdentifier& forItemIdentifier,
                       ItemHandler completionHandler) override;

  // Thumbnails: file_thumbnails.cpp, thumbnail_fetches.cpp and container_thumbnails.cpp. Images are
  // those that the record store has; none is drawn here.

  /// Blocks its thread for the daemon's replies. The progress counts nothing; cancelling it cancels
  /// every fetch of the request. The last failure of a fetch is the completion's.
  NSProgressRef fetchThumbnailsForItemIdentifiers(
      const std::vector<NSFileProviderItemIdentifier>& identifiers, CGSize requestedSize,
      TypedThumbnailHandler perThumbnailCompletionHandlerWithType,
      ErrorHandler completionHandler) override;
  /// Sends itself again, with the handler wrapped: only a subclass ends that.
  NSProgressRef fetchThumbnailsForItemIdentifiers(
      const std::vector<NSFileProviderItemIdentifier>& identifiers, CGSize requestedSize,
      ThumbnailHandler perThumbnailCompletionHandler, ErrorHandler completionHandler) override;

  /// Hands over the ids in batches of what a fetch takes at most; none are left.
  void batchRecordIDsToFetchThumbnails(
      std::vector<RZRecordID>& recordIDs,
      const std::function<void(const std::vector<RZRecordID>& batch)>& perBatchExecutionBlock);

  using ThumbnailOperations =
      std::shared_ptr<std::vector<std::shared_ptr<RZFetchRecordsOperation>>>;
  using ThumbnailZones = std::shared_ptr<std::vector<RZRecordZoneID>>;
  /// Runs the operations one after the other, each in the database that has its zone; they are
  /// taken from the arrays, which a subclass may look at before. The completion gets the last
  /// error.
  virtual void launchNewFetchThumbnailOperationFrom(const ThumbnailOperations& operations,
                                                    const ThumbnailZones& withZoneIDs,
                                                    const std::shared_ptr<RZContainer>& inContainer,
                                                    const NSErrorRef& previousError,
                                                    const ErrorHandler& completionHandler);

  /// The largest square in both the size and what containers' icons are shown at.
  [[nodiscard]] CGSize _properSizeForContainerThumbnail(CGSize size);
  /// Answers with the container's own icon, on the calling thread.
  void _fetchThumbnailForContainerID(
      const std::string& containerID,
      const NSFileProviderItemIdentifier& representedByItemWithIdentifer, CGSize size,
      const std::map<std::string, QSContainerRef>& knownContainers,
      const TypedThumbnailHandler& perThumbnailCompletionHandler);

  // Services: service_selection.cpp.

  /// Collaboration and sharing of a document that is no bookmark, sharing of a folder that the
  /// daemon says can be shared, and nothing else. Never fails; the error is never written. Blocks
  /// its thread for the daemon's replies.
  std::vector<NSFileProviderServiceSourceRef> supportedServiceSourcesForItemIdentifier(
      const NSFileProviderItemIdentifier& identifier, NSErrorRef* error = nullptr) override;

  // An application's folder: default_application_container.cpp.

  /// Without a bundle, and for the drive's own files browser, the Documents folder of the root.
  void _defaultApplicationContainerForBundleIdentifier(
      const std::optional<std::string>& bundleIdentifier, ItemHandler completionHandler) override;

  // Errors: collision_errors.cpp.

  /// A clash of names becomes the framework's collision error with the item in the way; any other
  /// error, and a clash whose item cannot be found, is answered as it is. Never logs.
  NSErrorRef fileProviderErrorFromFSError(const NSErrorRef& error);

  // Lookup: item_lookup.cpp.

  /// The item's location, or nil: bookmarks resolved, no physical mark.
  NSURLRef URLForItemWithPersistentIdentifier(
      const NSFileProviderItemIdentifier& identifier) override;
  // NOLINTBEGIN(clang-diagnostic-reserved-identifier): given, and a member's
  NSURLRef _URLForItemWithPersistentIdentifier(const NSFileProviderItemIdentifier& identifier,
                                               ResolveAliases resolvingQSAliases);
  NSURLRef _URLForItemWithPersistentIdentifier(const NSFileProviderItemIdentifier& identifier,
                                               ResolveAliases resolvingQSAliases,
                                               AttachPhysical attachPhysical);
  // NOLINTEND(clang-diagnostic-reserved-identifier)
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

 protected:
  /// For a subclass, which observes no account.
  QSFileProviderExtension();

 private:
  struct ThumbnailRequest;
  /// The documents among the identifiers; the others are answered at once.
  std::vector<QSFileObjectIDRef> _answerOtherThumbnails(
      const std::vector<NSFileProviderItemIdentifier>& identifiers, CGSize requestedSize,
      const TypedThumbnailHandler& handler);
  /// The fetches of the request, one for each batch.
  void _addThumbnailFetches(const std::shared_ptr<ThumbnailRequest>& request,
                            const ThumbnailOperations& operations, const ThumbnailZones& zoneIDs);
  void _didFetchThumbnailRecord(const ThumbnailRequest& request, const RZRecordRef& record,
                                const RZRecordID& recordID, const NSErrorRef& error);
  /// Downloads the file when this machine could draw it.
  void _downloadForThumbnail(const std::optional<NSFileProviderItemIdentifier>& identifier);

  void _provideItemAtURL(const NSURLRef& url, NSFileCoordinatorReadingOptions readingOptions,
                         std::uint64_t section, ErrorHandler completionHandler);
  void _didProvideItemAtPath(const std::string& path, std::uint64_t section,
                             const NSErrorRef& error, const ErrorHandler& completionHandler);
  /// Whether the item is downloaded so that it, or a folder above it, can be moved.
  bool _isDownloadingForMove(const NSURLRef& url);

  struct Reparenting;
  void _refuseReparenting(const std::shared_ptr<Reparenting>& request);
  void _provideForReparenting(const std::shared_ptr<Reparenting>& request);
  void _didProvideForReparenting(const std::shared_ptr<Reparenting>& request,
                                 const NSErrorRef& error);
  void _reparent(const std::shared_ptr<Reparenting>& request);

  NSURLRef _untrashDestination(
      const NSURLRef& url,
      const std::optional<NSFileProviderItemIdentifier>& toParentItemIdentifier);
  /// Answers the item at the location that a change of the tree led to, or that change's failure.
  void _answerItemAtNewURL(const NSURLRef& url, const NSErrorRef& error,
                           const ItemHandler& completionHandler);
  void _answerContainerWithIdentifier(const std::string& containerID,
                                      ItemHandler completionHandler);

  // "The lock of the object itself", and that of the array. Never hold both at once, nor either
  // while calling out, except that a stop looks the array's items up while it holds the array's.
  RecursiveMutex _lock;
  RecursiveMutex _itemsForcedDownloadLock;

  // In this order: they are released from the last to the first.

  /// The downloads in flight, by the item's path.
  std::map<std::string, std::shared_ptr<QSFileProvidingOperation>> _downloadOperationByPath
      GUARDED_BY(_lock);
  std::shared_ptr<NSOperationQueue> _operationQueue;
  /// Part of the object's footprint; nothing is submitted to it.
  std::shared_ptr<SerialQueue> _queue;
  /// The items whose download was forced so that they could be renamed or moved.
  std::vector<std::string> _itemsForcedDownload GUARDED_BY(_itemsForcedDownloadLock);
};

}  // namespace yomber
