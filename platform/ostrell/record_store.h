#pragma once

#include <string>

#include "platform/rozzel/operation_group.h"

namespace yomber {

/// Makes the record store in `folder` the one of this process: its containers are those of the
/// account that is signed in to the drive when they are asked for. Touches nothing yet.
void installRecordStore(const std::string& folder);

/// The group of the fetches that bring the thumbnails which somebody is waiting for.
[[nodiscard]] RZOperationGroupRef qs_downloadThumbnailsUserInitiated();

}  // namespace yomber
