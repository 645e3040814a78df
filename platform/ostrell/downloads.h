#pragma once

#include <cstdint>
#include <vector>

#include "platform/ostrell/content_protocol.h"

namespace yomber {

/// Options of QSStartDownloadForItemsWithOptions: the program asks by itself, no user does.
inline constexpr std::uint64_t QSStartDownloadNotUserInitiated = 4;

/// Has the daemon bring the content of these items here. The completion (may be empty) is called
/// once, on the library's reply queue: with nil when the downloads have begun, else with why none
/// has. Nobody waits for them, and they are not taken back.
void QSStartDownloadForItemsWithOptions(const std::vector<NSURLRef>& urls, std::uint64_t options,
                                        QSErrorReply completion);

}  // namespace yomber
