#pragma once

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "platform/fileprovider/enumerator.h"
#include "platform/foundation/lock.h"

namespace yomber {

/// One page of a listing, or why there is none.
struct EnumeratedPage {
  NSFileProviderItems items;
  NSFileProviderPage next;  ///< nil: the listing is complete
  NSErrorRef error;         ///< when set, nothing else counts
};

/// One batch of changes, or why there is none.
struct EnumeratedChanges {
  NSFileProviderItems updated;
  std::vector<NSFileProviderItemIdentifier> deleted;
  NSFileProviderSyncAnchor anchor;
  bool moreComing = false;
  NSErrorRef error;  ///< when set, nothing else counts
};

/// Collects what an enumerator tells until it finishes, then hands it over, once.
///
/// Calls after the finish are programming errors of the enumerator: they are logged at fault level
/// and change nothing. An observer that is let go unfinished hands over an error, so that whoever
/// waits learns of it. Nil items are left out.
///
/// Thread-safety: as the observer protocols ask; calls that race are safe too. The handler is
/// called on the finishing thread.
class PageObserver final : public NSFileProviderEnumerationObserver {
 public:
  using Handler = std::function<void(EnumeratedPage)>;
  explicit PageObserver(Handler handler);
  ~PageObserver() override;

  void didEnumerateItems(const NSFileProviderItems& items) override;
  void finishEnumeratingUpToPage(NSFileProviderPage nextPage) override;
  void finishEnumeratingWithError(NSErrorRef error) override;

 private:
  Mutex mutex_;
  Handler handler_ GUARDED_BY(mutex_);  ///< empty once finished
  EnumeratedPage page_ GUARDED_BY(mutex_);
};

/// The same for changes.
class ChangesObserver final : public NSFileProviderChangeObserver {
 public:
  using Handler = std::function<void(EnumeratedChanges)>;
  explicit ChangesObserver(Handler handler);
  ~ChangesObserver() override;

  void didUpdateItems(const NSFileProviderItems& items) override;
  void didDeleteItemsWithIdentifiers(
      const std::vector<NSFileProviderItemIdentifier>& identifiers) override;
  void finishEnumeratingChangesUpToSyncAnchor(NSFileProviderSyncAnchor anchor,
                                              bool moreComing) override;
  void finishEnumeratingWithError(NSErrorRef error) override;

 private:
  Mutex mutex_;
  Handler handler_ GUARDED_BY(mutex_);  ///< empty once finished
  EnumeratedChanges changes_ GUARDED_BY(mutex_);
};

}  // namespace yomber
