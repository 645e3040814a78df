#pragma once

#include <functional>
#include <string>
#include <vector>

#include "platform/fileprovider/thumbnail.h"
#include "platform/foundation/size.h"
#include "yomber/drive_client.h"

namespace yomber {

/// Asks the host for thumbnails. `take` is called once for each of the items, as soon as its
/// thumbnail is known, on threads of the pool, one at a time; the host waits meanwhile. Answers
/// when all have been told of: nil, the last failure of several, or why nobody answers.
///
/// Not on the loop thread.
[[nodiscard]] NSErrorRef fetchThumbnails(
    DriveClient& client, const std::vector<NSFileProviderItemIdentifier>& identifiers, CGSize size,
    const std::function<void(const ItemThumbnail& thumbnail)>& take);

}  // namespace yomber
