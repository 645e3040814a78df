#pragma once

#include <memory>

#include "mount/content_requests.h"
#include "mount/node_table.h"

namespace yomber {

/// Whether no name leads to a file any more, of which there is a descriptor (of its place at
/// least).
[[nodiscard]] bool isRemoved(int descriptor);

/// Brings the content of a file that was removed, or replaced, while somebody has it open. The
/// drive does not know it any more; what it was, its fault says, and the store keeps that for a
/// while.
///
/// `place` is a descriptor of the file. Answered, and taken back, as ContentRequests::provide.
[[nodiscard]] std::shared_ptr<ContentRequests::Request> provideRemoved(
    SharedDescriptor place, ContentRequests::Completion completion);

}  // namespace yomber
