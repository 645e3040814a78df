#pragma once

#include <optional>

#include "platform/rozzel/asset.h"
#include "zarn/connection.h"

namespace yomber {

// Which thumbnail belongs to some content, whatever documents have it. All throw SQLite::Exception;
// what changes something needs the writer's connection.

/// What was made of some content.
struct ThumbnailRow {
  RZAsset content;
  std::optional<RZAsset> thumbnail;  ///< nothing: it cannot be drawn
};

/// Nothing when nobody has tried to draw it, or only before more could be drawn.
[[nodiscard]] std::optional<ThumbnailRow> findThumbnail(Connection& connection,
                                                        const RZAsset& content);
void storeThumbnail(Connection& connection, const ThumbnailRow& row);
/// Removes those of contents that no document has any more.
void removeUnusedThumbnails(Connection& connection);

}  // namespace yomber
