#pragma once

#include "platform/fileprovider/enumerator.h"
#include "platform/foundation/uuid.h"

namespace yomber {

/// Relays the working set's changes from the daemon, which keeps their history and makes the
/// anchors. The listing is empty and asks the framework to fetch changes; from the initial anchor
/// on they bring the whole set. Calls are independent of each other: those in flight finish their
/// observers also after `invalidate`.
///
/// Thread-safety: every operation may be called on any thread; observers are called on the daemon
/// connection's reply queue.
class QSWorkingSetEnumerator final : public NSFileProviderChangeEnumerator {
 public:
  /// The anchor that stands for the beginning.
  [[nodiscard]] static NSFileProviderSyncAnchor initialSyncAnchor();

  /// `page` does not matter.
  void enumerateItemsForObserver(NSFileProviderEnumerationObserverRef observer,
                                 NSFileProviderPage page) override;
  void enumerateChangesForObserver(NSFileProviderChangeObserverRef observer,
                                   NSFileProviderSyncAnchor anchor) override;
  /// Always the initial anchor, given at once.
  void currentSyncAnchorWithCompletionHandler(
      std::function<void(NSFileProviderSyncAnchor)> completionHandler) override;
  void invalidate() override {}

 private:
  [[maybe_unused]] UUID _uuid{};  // Neither read nor written.
};

}  // namespace yomber
