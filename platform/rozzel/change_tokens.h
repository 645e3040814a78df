#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/rozzel/engine.h"

namespace yomber {

/// What a change token says.
struct ChangePosition {
  /// Which store and which zone it is of.
  std::int64_t store = 0;
  std::int64_t zone = 0;
  /// All changes up to this one are known to the reader.
  std::int64_t sequence = 0;
  /// The zone's last change when the reader began. Deletions up to it are none of the reader's
  /// business: it never saw those records.
  std::int64_t beginning = 0;
};

[[nodiscard]] RZChangeToken encodeChangeToken(const ChangePosition& position);
/// None: these bytes are no token.
[[nodiscard]] std::optional<ChangePosition> decodeChangeToken(const RZChangeToken& token);

/// Where a query's next page begins: after a record name of a zone.
[[nodiscard]] std::string encodeQueryCursor(std::int64_t zone, std::string_view lastName);
/// The name; none: these bytes are no cursor of that zone.
[[nodiscard]] std::optional<std::string> decodeQueryCursor(std::int64_t zone,
                                                           std::string_view cursor);

}  // namespace yomber
