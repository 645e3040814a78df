#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>

#include "platform/rozzel/engine.h"
#include "zarn/database.h"

namespace yomber {

/// Has the record store drop what nobody refers to any longer, once a day.
///
/// When that was done last is stored, so that a zarn that is started often does it no more often.
/// For one thread at a time; blocks for as long as it takes, while the store's other users go on.
class StoreUpkeep {
 public:
  struct Options {
    std::function<std::int64_t()> clock;  ///< ns since the epoch; empty: the machine's
    std::chrono::nanoseconds interval = std::chrono::hours(24);
    /// So much later it is done even though there are jobs to do.
    std::chrono::nanoseconds patience = std::chrono::hours(24);
  };
  /// `isIdle` says whether there are no jobs.
  StoreUpkeep(RZEngineRef records, std::shared_ptr<Database> database, std::function<bool()> isIdle,
              Options options);

  /// Does it when it is due. Answers whether it was done; a store that is out of reach, or fails,
  /// is asked again the next time.
  bool runIfDue();

 private:
  [[nodiscard]] bool isDue(std::int64_t now) const;
  [[nodiscard]] std::int64_t now() const;

  const RZEngineRef records_;
  const std::shared_ptr<Database> database_;
  const std::function<bool()> isIdle_;
  const Options options_;
};

}  // namespace yomber
