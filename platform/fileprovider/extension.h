#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/fileprovider/constants.h"
#include "platform/fileprovider/enumerator.h"
#include "platform/fileprovider/item.h"
#include "platform/fileprovider/service_source.h"
#include "platform/foundation/data.h"
#include "platform/foundation/date.h"
#include "platform/foundation/error.h"
#include "platform/foundation/progress.h"
#include "platform/foundation/size.h"
#include "platform/foundation/url.h"

namespace yomber {

using ErrorHandler = std::function<void(NSErrorRef error)>;
using ItemHandler = std::function<void(NSFileProviderItemRef item, NSErrorRef error)>;
using MoveHandler = std::function<void(bool requiresProviding, NSErrorRef error)>;
using URLHandler = std::function<void(NSURLRef url, NSErrorRef error)>;

/// Takes the thumbnail of one item: an image, nothing where the item has none, or an error.
using ThumbnailHandler = std::function<void(const NSFileProviderItemIdentifier& identifier,
                                            NSDataRef imageData, NSErrorRef error)>;
/// The same with the image's type, for images that are not to be shown as they are; nothing for
/// those that are.
using TypedThumbnailHandler =
    std::function<void(const NSFileProviderItemIdentifier& identifier, NSDataRef imageData,
                       const std::optional<std::string>& contentType, NSErrorRef error)>;

/// How the content is going to be read: Foundation's file-coordination reading options, a bit set.
using NSFileCoordinatorReadingOptions = std::uint64_t;

/// The base class of a file-provider extension. The host calls these operations concurrently, on
/// threads of its own choosing; each has the framework's default answer, so that an extension
/// overrides just what it does.
///
/// Synchronous operations may block their thread. Handlers may be empty; those given are called
/// exactly once, on any thread. The default answer of an asynchronous operation is
/// NSFeatureUnsupportedError.
class NSFileProviderExtension {
 public:
  NSFileProviderExtension();
  virtual ~NSFileProviderExtension();
  NSFileProviderExtension(const NSFileProviderExtension&) = delete;
  NSFileProviderExtension& operator=(const NSFileProviderExtension&) = delete;

  // Lookups and enumeration.
  virtual NSURLRef URLForItemWithPersistentIdentifier(
      const NSFileProviderItemIdentifier& identifier);
  virtual std::optional<NSFileProviderItemIdentifier> persistentIdentifierForItemAtURL(
      const NSURLRef& url);
  virtual NSFileProviderItemRef itemForIdentifier(const NSFileProviderItemIdentifier& identifier,
                                                  NSErrorRef* error = nullptr);
  virtual NSFileProviderEnumeratorRef enumeratorForContainerItemIdentifier(
      const NSFileProviderItemIdentifier& identifier, NSErrorRef* error = nullptr);

  // Content.
  virtual void providePlaceholderAtURL(const NSURLRef& url, ErrorHandler completionHandler);
  virtual void startProvidingItemAtURL(const NSURLRef& url, ErrorHandler completionHandler);
  /// Forwards to the form without options, for an extension that makes no difference.
  virtual void startProvidingItemAtURL(const NSURLRef& url,
                                       NSFileCoordinatorReadingOptions readingOptions,
                                       ErrorHandler completionHandler);
  virtual void stopProvidingItemAtURL(const NSURLRef& url);
  virtual void itemChangedAtURL(const NSURLRef& url);
  /// Whether the content at `url` has to be here before it can be moved to `destinationURL`.
  virtual void movingItemAtURL(const NSURLRef& url, const NSURLRef& destinationURL,
                               MoveHandler completionHandler);

  // Changes of the tree. An item that is answered is the item as it is after the change.
  virtual void importDocumentAtURL(const NSURLRef& url,
                                   const NSFileProviderItemIdentifier& toParentItemIdentifier,
                                   ItemHandler completionHandler);
  virtual void createDirectoryWithName(const std::string& name,
                                       const NSFileProviderItemIdentifier& inParentItemIdentifier,
                                       ItemHandler completionHandler);
  virtual void renameItemWithIdentifier(const NSFileProviderItemIdentifier& identifier,
                                        const std::string& toName, ItemHandler completionHandler);
  /// Without a new name the item keeps the one it has.
  virtual void reparentItemWithIdentifier(
      const NSFileProviderItemIdentifier& identifier,
      const NSFileProviderItemIdentifier& toParentItemWithIdentifier,
      const std::optional<std::string>& newName, ItemHandler completionHandler);
  virtual void trashItemWithIdentifier(const NSFileProviderItemIdentifier& identifier,
                                       ItemHandler completionHandler);
  /// Without a parent the item goes back to where it came from.
  virtual void untrashItemWithIdentifier(
      const NSFileProviderItemIdentifier& identifier,
      const std::optional<NSFileProviderItemIdentifier>& toParentItemIdentifier,
      ItemHandler completionHandler);
  virtual void deleteItemWithIdentifier(const NSFileProviderItemIdentifier& identifier,
                                        ErrorHandler completionHandler);
  virtual void _trashItemAtURLWithoutCoordination(const NSURLRef& url,
                                                  URLHandler completionHandler);

  // Attributes; nothing (nil data) takes the attribute away.
  virtual void setLastUsedDate(const std::optional<NSDate>& date,
                               const NSFileProviderItemIdentifier& forItemIdentifier,
                               ItemHandler completionHandler);
  /// `tagData` is of the form that tags_data.h describes.
  virtual void setTagData(const NSDataRef& tagData,
                          const NSFileProviderItemIdentifier& forItemIdentifier,
                          ItemHandler completionHandler);
  virtual void setFavoriteRank(const std::optional<std::int64_t>& rank,
                               const NSFileProviderItemIdentifier& forItemIdentifier,
                               ItemHandler completionHandler);

  // Thumbnails, in points. Each is handed over as soon as it is known, on any thread, which the
  // handler may hold up; then comes the completion. Cancelling the progress that is answered ends
  // the request early. The framework asks for the typed form.

  /// Forwards to the form without types, for an extension that knows none.
  virtual NSProgressRef fetchThumbnailsForItemIdentifiers(
      const std::vector<NSFileProviderItemIdentifier>& identifiers, CGSize requestedSize,
      TypedThumbnailHandler perThumbnailCompletionHandlerWithType, ErrorHandler completionHandler);
  virtual NSProgressRef fetchThumbnailsForItemIdentifiers(
      const std::vector<NSFileProviderItemIdentifier>& identifiers, CGSize requestedSize,
      ThumbnailHandler perThumbnailCompletionHandler, ErrorHandler completionHandler);

  /// What vends the services of an item, each made for this call. The default is none.
  virtual std::vector<NSFileProviderServiceSourceRef> supportedServiceSourcesForItemIdentifier(
      const NSFileProviderItemIdentifier& identifier, NSErrorRef* error = nullptr);

  /// An application's default folder; without a bundle, that of the drive itself.
  virtual void _defaultApplicationContainerForBundleIdentifier(
      const std::optional<std::string>& bundleIdentifier, ItemHandler completionHandler);
};

}  // namespace yomber
