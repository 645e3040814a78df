#pragma once

#include "platform/foundation/error.h"
#include "platform/rozzel/asset.h"

namespace yomber {

/// Hashes all of `source` (a regular file) from its start, reading and hashing at the same time.
///
/// Here and below: the position of a descriptor may be moved, so it is the call's own while it
/// lasts. Failures are RZErrorDomain, or Cocoa 3072 when `transfer` cancelled.
[[nodiscard]] NSErrorRef rz_hashFile(int source, const RZTransfer& transfer, RZAsset& asset);

/// Copies all of `source` into `target` at the same offsets and hashes it on the way. Holes of the
/// source and blocks of zeros are not written, so the target must read as zeros there; its size is
/// not set. `asset` is what was copied, even if the source changed meanwhile.
[[nodiscard]] NSErrorRef rz_copyAndHashFile(int source, int target, const RZTransfer& transfer,
                                            RZAsset& asset);

}  // namespace yomber
