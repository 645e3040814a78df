#pragma once

#include <string>

#include "platform/fileprovider/extension.h"

namespace yomber {

/// The reading options that have a name here; what the daemon does not know it ignores.
inline constexpr NSFileCoordinatorReadingOptions NSFileCoordinatorReadingWithoutChanges = 1U << 0U;
inline constexpr NSFileCoordinatorReadingOptions NSFileCoordinatorReadingResolvesSymbolicLink =
    1U << 1U;
inline constexpr NSFileCoordinatorReadingOptions
    NSFileCoordinatorReadingImmediatelyAvailableMetadataOnly = 1U << 2U;
inline constexpr NSFileCoordinatorReadingOptions NSFileCoordinatorReadingForUploading = 1U << 3U;
/// Provide also what is here already: what is going on with it (an eviction, say) has ended when
/// the answer comes.
inline constexpr NSFileCoordinatorReadingOptions QSFileCoordinatorReadingForcesProviding = 1U
                                                                                           << 17U;

/// The options by name, joined with '|'; bits without a name as one hexadecimal number. For logs.
[[nodiscard]] std::string QSFileCoordinatorReadingOptionsPrettyPrint(
    NSFileCoordinatorReadingOptions options);

}  // namespace yomber
