#pragma once

#include <cstdint>
#include <string>

#include "platform/foundation/data.h"

namespace yomber {

/// An item's name between host and extension. The constants below name no ordinary item; they are
/// never destroyed, so that threads which outlive `main` may still use them.
using NSFileProviderItemIdentifier = std::string;

inline const NSFileProviderItemIdentifier& NSFileProviderRootContainerItemIdentifier =
    *new NSFileProviderItemIdentifier("NSFileProviderRootContainerItemIdentifier");
inline const NSFileProviderItemIdentifier& NSFileProviderWorkingSetContainerItemIdentifier =
    *new NSFileProviderItemIdentifier("NSFileProviderWorkingSetContainerItemIdentifier");
inline const NSFileProviderItemIdentifier& NSFileProviderAllDirectoriesContainerItemIdentifier =
    *new NSFileProviderItemIdentifier("NSFileProviderAllDirectoriesContainerItemIdentifier");
inline const NSFileProviderItemIdentifier& NSFileProviderTrashContainerItemIdentifier =
    *new NSFileProviderItemIdentifier("NSFileProviderTrashContainerItemIdentifier");

/// Where a listing resumes, and from which point changes are wanted: opaque to all but their maker.
using NSFileProviderPage = NSDataRef;
using NSFileProviderSyncAnchor = NSDataRef;

/// The pages that start a listing. Only compared, never parsed.
extern const NSFileProviderPage NSFileProviderInitialPageSortedByDate;
extern const NSFileProviderPage NSFileProviderInitialPageSortedByName;

/// The framework's error domain; these are the conditions that the host acts on.
inline constexpr const char* NSFileProviderErrorDomain = "NSFileProviderErrorDomain";
inline constexpr std::int64_t NSFileProviderErrorNotAuthenticated = -1000;
inline constexpr std::int64_t NSFileProviderErrorFilenameCollision = -1001;
inline constexpr std::int64_t NSFileProviderErrorSyncAnchorExpired = -1002;
inline constexpr std::int64_t NSFileProviderErrorServerUnreachable = -1003;
inline constexpr std::int64_t NSFileProviderErrorInsufficientQuota = -1004;
inline constexpr std::int64_t NSFileProviderErrorNoSuchItem = -1005;

/// User-information keys of that domain's errors.
inline constexpr const char* NSFileProviderErrorItemKey = "NSFileProviderErrorItem";
inline constexpr const char* NSFileProviderErrorNonExistentItemIdentifierKey =
    "NSFileProviderErrorNonExistentItemIdentifier";

/// What may be done with an item; bits of `NSFileProviderItem::capabilities`.
enum NSFileProviderItemCapabilities : std::uint32_t {
  NSFileProviderItemCapabilitiesAllowsReading = 1U << 0U,
  NSFileProviderItemCapabilitiesAllowsWriting = 1U << 1U,
  NSFileProviderItemCapabilitiesAllowsReparenting = 1U << 2U,
  NSFileProviderItemCapabilitiesAllowsRenaming = 1U << 3U,
  NSFileProviderItemCapabilitiesAllowsTrashing = 1U << 4U,
  NSFileProviderItemCapabilitiesAllowsDeleting = 1U << 5U,
  NSFileProviderItemCapabilitiesAllowsAddingSubItems = NSFileProviderItemCapabilitiesAllowsWriting,
  NSFileProviderItemCapabilitiesAllowsContentEnumerating =
      NSFileProviderItemCapabilitiesAllowsReading,
};

}  // namespace yomber
