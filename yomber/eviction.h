#pragma once

#include <cstdint>
#include <string>

#include "platform/foundation/error.h"
#include "yomber/drive_content.h"

namespace yomber {

/// What came of giving up the content of one document, and why.
struct Eviction {
  enum class Outcome {
    Evicted,  ///< the content is gone from here
    Absent,   ///< it was not here
    Kept,     ///< it stays, for `reason`
  };
  Outcome outcome = Outcome::Kept;
  std::string reason;
  std::uint64_t localBytes = 0;  ///< of blocks, afterwards
  NSErrorRef error;              ///< nothing could be found out
};

/// "evicted", "absent", "kept".
[[nodiscard]] const char* nameOf(Eviction::Outcome outcome);

/// Asks the host to have the content given up. The extension answers nothing, so the daemon is
/// asked what came of it.
[[nodiscard]] Eviction evictContent(const DriveContent& content, const std::string& path);

/// Why content in that state stays here; empty when the state does not say.
[[nodiscard]] std::string reasonToKeep(const ContentState& state);

}  // namespace yomber
