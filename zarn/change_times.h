#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "zarn/item_attributes.h"
#include "zarn/item_row.h"

namespace yomber {

/// A scan knows by its change time (ctime) that a file is as it was when it was last read. What is
/// here keeps a change from hiding behind a time that was remembered too early. All times are ns
/// since the epoch. Thread-safety: every function may be called on any thread.

/// Whether a change that comes after a look at a file is sure to get another time than the one the
/// look found. `before` and `after` are the kernel's coarse clock around the look: where a file
/// system takes its times from there, all changes within one tick get the same one.
[[nodiscard]] constexpr bool isSettledTime(std::int64_t ctime, std::int64_t before,
                                           std::int64_t after) {
  return ctime < before || (before == after && ctime != before);
}

/// CLOCK_REALTIME_COARSE.
[[nodiscard]] std::int64_t coarseNow();

/// Until the tick that runs is over: some milliseconds at most. What changes from then on is not
/// given the times of what was done before.
void waitForTick();

/// Whether the attributes are what a file with this row carries, apart from whether its content is
/// here.
[[nodiscard]] bool isDescribedBy(const ItemRow& row, const ItemAttributes& attributes);

/// The time to remember of the file `name` ("." is the folder itself) in the folder open as
/// `folder`, after the drive has written to the file's attributes: provided that the file still is
/// as the row says, attributes included. Nothing where something else has changed too; the older
/// time then makes the next scan look again.
[[nodiscard]] std::optional<std::int64_t> changeTimeAfterOwnWrite(int folder,
                                                                  const std::string& name,
                                                                  const ItemRow& row);

}  // namespace yomber
