#pragma once

#include <functional>
#include <string>
#include <vector>

#include "platform/fileprovider/enumerator.h"
#include "platform/foundation/lock.h"

namespace yomber {

/// What both observers below record, in order: "items", "updates", "deletions", "page", "anchor" or
/// "error" for each call.
///
/// Thread-safety: every operation may be called on any thread.
class RecordedCalls {
 public:
  [[nodiscard]] std::vector<std::string> calls() const;
  /// Waits up to ten seconds for the first `finish…`.
  [[nodiscard]] bool waitUntilFinished() const;
  [[nodiscard]] bool isFinished() const;
  [[nodiscard]] NSErrorRef error() const;

 protected:
  void record(const std::string& call);
  void recordError(NSErrorRef error);

  mutable Mutex _lock;
  mutable Condition _changed;
  std::vector<std::string> _calls GUARDED_BY(_lock);
  NSErrorRef _error GUARDED_BY(_lock);
  bool _finished GUARDED_BY(_lock) = false;
};

class RecordingEnumerationObserver : public NSFileProviderEnumerationObserver,
                                     public RecordedCalls {
 public:
  void didEnumerateItems(const NSFileProviderItems& items) override;
  void finishEnumeratingUpToPage(NSFileProviderPage nextPage) override;
  void finishEnumeratingWithError(NSErrorRef error) override;

  [[nodiscard]] std::vector<NSFileProviderItemIdentifier> identifiers() const;
  [[nodiscard]] NSFileProviderItems items() const;
  [[nodiscard]] NSFileProviderPage nextPage() const;

 private:
  NSFileProviderItems _items GUARDED_BY(_lock);
  NSFileProviderPage _nextPage GUARDED_BY(_lock);
};

class RecordingChangeObserver : public NSFileProviderChangeObserver, public RecordedCalls {
 public:
  void didUpdateItems(const NSFileProviderItems& items) override;
  void didDeleteItemsWithIdentifiers(
      const std::vector<NSFileProviderItemIdentifier>& identifiers) override;
  void finishEnumeratingChangesUpToSyncAnchor(NSFileProviderSyncAnchor anchor,
                                              bool moreComing) override;
  void finishEnumeratingWithError(NSErrorRef error) override;

  /// Sorted, since their order says nothing.
  [[nodiscard]] std::vector<NSFileProviderItemIdentifier> updated() const;
  [[nodiscard]] std::vector<NSFileProviderItemIdentifier> deleted() const;
  [[nodiscard]] NSFileProviderSyncAnchor anchor() const;
  [[nodiscard]] bool moreComing() const;

  /// Called inside each call named so, on the caller's thread.
  std::function<void(const std::string& call)> whileCalled;

 private:
  std::vector<NSFileProviderItemIdentifier> _updated GUARDED_BY(_lock);
  std::vector<NSFileProviderItemIdentifier> _deleted GUARDED_BY(_lock);
  NSFileProviderSyncAnchor _anchor GUARDED_BY(_lock);
  bool _moreComing GUARDED_BY(_lock) = false;
};

}  // namespace yomber
