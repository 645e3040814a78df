#pragma once

#include "platform/foundation/error.h"
#include "platform/rozzel/asset.h"

namespace yomber {

/// Copies all of `source` (a regular file) into `target` at the same offsets, in the kernel where
/// that can do it, and hashes what `target` then holds, at the same time. Holes of the source are
/// not written, so the target must read as zeros there; its size is not set. `asset` is what the
/// target holds, whoever else wrote to it.
///
/// The target must be open for reading and writing. Failures are RZErrorDomain, or Cocoa 3072 when
/// `transfer` cancelled.
[[nodiscard]] NSErrorRef rz_copyAndHashTarget(int source, int target, const RZTransfer& transfer,
                                              RZAsset& asset);

}  // namespace yomber
