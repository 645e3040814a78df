#pragma once

#include <string_view>

namespace yomber {

/// What this machine's own thumbnail service can do.
///
/// Thread-safety: every operation may be called on any thread.
class GMThumbnailStoreRetrievalOperation {
 public:
  /// Whether a thumbnailer that is installed here draws content of this type, once the content is
  /// here. `uti` is the item's type identifier, a MIME type. Reads files; takes microseconds.
  [[nodiscard]] static bool canMostRecentClientsGenerateThumbnailsForUTI(std::string_view uti);
};

}  // namespace yomber
