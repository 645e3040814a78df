#pragma once

#include <functional>
#include <memory>
#include <vector>

#include "platform/fileprovider/constants.h"
#include "platform/fileprovider/item.h"
#include "platform/foundation/error.h"

namespace yomber {

/// Receives one page of a listing: any number of `didEnumerateItems`, then exactly one `finish…`.
/// Thread-safety: callable on any thread, one call at a time.
class NSFileProviderEnumerationObserver {
 public:
  virtual ~NSFileProviderEnumerationObserver() = default;
  virtual void didEnumerateItems(const NSFileProviderItems& items) = 0;
  /// `nextPage` is nil when the listing is complete.
  virtual void finishEnumeratingUpToPage(NSFileProviderPage nextPage) = 0;
  virtual void finishEnumeratingWithError(NSErrorRef error) = 0;
};

/// Receives one batch of changes, then exactly one `finish…`.
class NSFileProviderChangeObserver {
 public:
  virtual ~NSFileProviderChangeObserver() = default;
  virtual void didUpdateItems(const NSFileProviderItems& items) = 0;
  virtual void didDeleteItemsWithIdentifiers(
      const std::vector<NSFileProviderItemIdentifier>& identifiers) = 0;
  virtual void finishEnumeratingChangesUpToSyncAnchor(NSFileProviderSyncAnchor anchor,
                                                      bool moreComing) = 0;
  virtual void finishEnumeratingWithError(NSErrorRef error) = 0;
};

using NSFileProviderEnumerationObserverRef = std::shared_ptr<NSFileProviderEnumerationObserver>;
using NSFileProviderChangeObserverRef = std::shared_ptr<NSFileProviderChangeObserver>;

/// Lists a container and its changes. Owned by the framework until `invalidate`.
class NSFileProviderEnumerator {
 public:
  virtual ~NSFileProviderEnumerator() = default;
  /// `page` is an initial page, a page this enumerator gave, or nil (the beginning, by name).
  virtual void enumerateItemsForObserver(NSFileProviderEnumerationObserverRef observer,
                                         NSFileProviderPage page) = 0;
  virtual void invalidate() = 0;
};

/// What an enumerator that can also tell changes implements. The framework asks by `dynamic_cast`
/// whether an enumerator is one.
class NSFileProviderChangeEnumerator : public NSFileProviderEnumerator {
 public:
  virtual void enumerateChangesForObserver(NSFileProviderChangeObserverRef observer,
                                           NSFileProviderSyncAnchor anchor) = 0;
  virtual void currentSyncAnchorWithCompletionHandler(
      std::function<void(NSFileProviderSyncAnchor)> completionHandler) = 0;
};

using NSFileProviderEnumeratorRef = std::shared_ptr<NSFileProviderEnumerator>;

}  // namespace yomber
