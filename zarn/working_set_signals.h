#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "platform/foundation/serial_queue.h"
#include "zarn/change_feed.h"
#include "zarn/coalesced_call.h"
#include "zarn/database.h"

namespace yomber {

/// Notices when the working set has changed, whatever changed it, and says so.
///
/// Commits are many and few of them touch the set: after each burst the feed is asked once whether
/// it has anything new. Ownership: shared; given to the database as a sink. Thread-safety: any
/// thread.
class WorkingSetSignals final : public ChangeSink {
 public:
  /// `signal` is called on a pool thread, one call at a time.
  WorkingSetSignals(std::shared_ptr<ChangeFeed> feed, std::function<void()> signal);
  ~WorkingSetSignals() override;

  /// Takes the set as it is now as known; what changes after the return is signalled. Blocks.
  void start();
  void committed(const std::vector<ItemChange>& changes) override;
  /// To be called now and then: items leave the set as time goes by. `now` in ns since the epoch.
  void expire(std::int64_t now);

 private:
  struct State;
  const std::shared_ptr<State> state_;
  const std::shared_ptr<CoalescedCall> check_;
};

}  // namespace yomber
