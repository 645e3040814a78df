#pragma once

#include <cstdint>

#include "platform/foundation/data.h"

namespace yomber {

// Page tokens: where a listing resumes. 16 bytes: the offset (64 bits, native order), the sort
// order (8 bits: 0 by name, 1 by date) and seven reserved bytes. The framework's two initial pages
// stand for offset 0 of their sort order.
//
// The readers check no length: missing bytes read as 0, and so does a nil page.

/// The token of a page; nil for offset 0, which is how a listing says that no page follows. The low
/// 8 bits of the sort order are kept.
[[nodiscard]] NSDataRef qs_pageTokenFromSortOrder(std::uint64_t sortOrder, std::uint64_t offset);
[[nodiscard]] std::uint64_t qs_pageTokenSortOrder(const NSDataRef& page);
/// How many entries were already delivered.
[[nodiscard]] std::uint64_t qs_pageTokenOffset(const NSDataRef& page);

}  // namespace yomber
