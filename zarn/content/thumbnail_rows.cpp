#include "zarn/content/thumbnail_rows.h"

#include <algorithm>

#include "zarn/schema.h"

namespace yomber {
namespace {

/// What could not be drawn is tried again when more can be.
std::int64_t drawingVersion(Connection& connection) {
  return metaInteger(connection, meta::kThumbnailAbilities);
}

std::string_view hashBytes(const RZAsset& asset) {
  return {reinterpret_cast<const char*>(asset.hash.data()), asset.hash.size()};
}

}  // namespace

std::optional<ThumbnailRow> findThumbnail(Connection& connection, const RZAsset& content) {
  StatementUse statement(
      connection.prepared("SELECT hash,size,version FROM thumbnail WHERE content=?1"));
  statement->bindBytes(1, hashBytes(content));
  if (!statement->step()) return std::nullopt;
  ThumbnailRow row{content, std::nullopt};
  if (statement->isNull(0)) {
    if (statement->integer(2) != drawingVersion(connection)) return std::nullopt;
    return row;
  }
  RZAsset& thumbnail = row.thumbnail.emplace();
  const std::string_view hash = statement->bytes(0);
  std::copy_n(hash.begin(), std::min(hash.size(), thumbnail.hash.size()), thumbnail.hash.begin());
  thumbnail.size = statement->id(1);
  return row;
}

void storeThumbnail(Connection& connection, const ThumbnailRow& row) {
  StatementUse statement(connection.prepared(
      "INSERT OR REPLACE INTO thumbnail(content,version,hash,size) VALUES(?1,?2,?3,?4)"));
  statement->bindBytes(1, hashBytes(row.content));
  statement->bindInteger(2, drawingVersion(connection));
  if (row.thumbnail) {
    statement->bindBytes(3, hashBytes(*row.thumbnail));
  } else {
    statement->bindNull(3);
  }
  statement->bindID(4, row.thumbnail ? row.thumbnail->size : 0);
  statement->step();
}

void removeUnusedThumbnails(Connection& connection) {
  Statement statement(connection.database(),
                      "DELETE FROM thumbnail WHERE content NOT IN "
                      "(SELECT hash FROM content WHERE hash IS NOT NULL)");
  statement.run();
}

}  // namespace yomber
