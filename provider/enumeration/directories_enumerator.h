#pragma once

#include "platform/fileprovider/enumerator.h"

namespace yomber {

/// Lists every folder of the drive, page by page. Tells no changes and keeps no state: a listing in
/// flight finishes its observer also after `invalidate`.
///
/// Thread-safety: every operation may be called on any thread; observers are called on the daemon
/// connection's reply queue.
class QSDirectoriesEnumerator final : public NSFileProviderEnumerator {
 public:
  void enumerateItemsForObserver(NSFileProviderEnumerationObserverRef observer,
                                 NSFileProviderPage page) override;
  void invalidate() override {}
};

}  // namespace yomber
