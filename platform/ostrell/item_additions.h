#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "platform/foundation/error.h"
#include "platform/foundation/url.h"
#include "platform/ostrell/container.h"
#include "platform/ostrell/move_capability.h"

namespace yomber {

// What the client library adds to locations of items. Those that ask the daemon are synchronous
// calls. A nil location answers false, zero or nil.

/// Whether this is a promise: the location of an item of the drive that has no file on this disk.
[[nodiscard]] bool qs_isPromiseURL(const NSURLRef& url);
/// Whether `url` is a folder above `other`, by the look of their paths. Nothing is its own parent.
[[nodiscard]] bool qs_isParentOfURL(const NSURLRef& url, const NSURLRef& other);

/// What a move to `toURL`, the location after the move, is and needs: bits of QSMoveCapability. 0,
/// or a reason without an allowing bit, is a refusal; it may come with an error. Asks the daemon.
[[nodiscard]] std::uint32_t qs_capabilityToMoveToURL(const NSURLRef& url, const NSURLRef& toURL,
                                                     NSErrorRef* error = nullptr);

/// Where the item with this logical location is on this disk; the location itself when the daemon
/// has no other answer. Asks the daemon.
[[nodiscard]] NSURLRef qs_physicalURL(const NSURLRef& url);

/// Replaces the item's tags; no names take them away. Asks the daemon.
bool qs_setTagNames(const NSURLRef& url, const std::vector<std::string>& names,
                    NSErrorRef* error = nullptr);

/// The container that holds the location; that of a trashed item is the one it came from, and the
/// drive's own where nobody knows. Documents and Desktop count while their folders
/// exist. Nil outside of all containers. Asks the daemon for the list of containers.
[[nodiscard]] QSContainerRef qs_ostrellContainer(const NSURLRef& url);

}  // namespace yomber
