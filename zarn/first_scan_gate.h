#pragma once

#include <kj/async.h>

#include <atomic>
#include <memory>
#include <vector>

#include "platform/foundation/atomic_cell.h"
#include "platform/foundation/error.h"

namespace yomber {

/// Calls that need the database's rows wait here until the tree was scanned for the first time.
///
/// Ownership: shared. Thread-safety: `wait` on the loop thread, the rest on any thread.
class FirstScanGate : public std::enable_shared_from_this<FirstScanGate> {
 public:
  [[nodiscard]] bool isOpen() const { return isOpen_.load(std::memory_order_acquire); }
  void open();
  /// The scan failed and will be tried again: calls are answered with the error until then.
  void fail(NSErrorRef error);
  /// A scan is being tried again: calls wait for it.
  void retry();

  /// Nil once the gate is open, in the order in which the calls came; or the failure.
  [[nodiscard]] kj::Promise<NSErrorRef> wait();

 private:
  void settle(NSErrorRef error);

  std::atomic<bool> isOpen_{false};
  AtomicCell<NSErrorRef> failure_;
  std::vector<kj::Own<kj::PromiseFulfiller<NSErrorRef>>> waiting_;  // loop thread
};

}  // namespace yomber
