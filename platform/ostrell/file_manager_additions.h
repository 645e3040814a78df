#pragma once

#include <cstdint>
#include <optional>

#include "platform/foundation/date.h"
#include "platform/foundation/error.h"
#include "platform/foundation/file_manager.h"
#include "platform/foundation/url.h"

namespace yomber {

// What the client library adds to the file manager: operations on items of the drive that the
// daemon makes. Each is a synchronous daemon call. A nil location fails with Cocoa error 4, where
// something can fail.

/// Gives up the item's local content; the item stays. QSOstrellErrorCannotEvict says why that
/// cannot be (not confirmed in the store, changed since, open, pinned).
bool evictUbiquitousItemAtURL(const NSFileManager& manager, const NSURLRef& url,
                              NSErrorRef* error = nullptr);

/// Moves the item to the drive's trash; `resultingURL` (may be null) is where it is there.
bool qs_trashItemAtURL(const NSFileManager& manager, const NSURLRef& url, NSURLRef* resultingURL,
                       NSErrorRef* error = nullptr);
/// Where the trashed item came from, or nil. That folder may be gone.
[[nodiscard]] NSURLRef qs_putBackURLForTrashedItemAtURL(const NSFileManager& manager,
                                                        const NSURLRef& url,
                                                        NSErrorRef* error = nullptr);

/// Records when the item was last opened; nothing takes the date away. A failure is logged only.
void qs_setLastOpenDate(const NSFileManager& manager, const std::optional<NSDate>& date,
                        const NSURLRef& onItemAtURL);
/// Records the item's place among the favourites; nothing takes it from them. A failure is logged
/// only.
void qs_setFavoriteRank(const NSFileManager& manager, const std::optional<std::int64_t>& rank,
                        const NSURLRef& onItemAtURL);

}  // namespace yomber
