#pragma once

#include <cstdint>
#include <string>

#include "zarn/connection.h"

namespace yomber {

/// The version of the tables that this program reads and writes.
inline constexpr std::int64_t kSchemaVersion = 7;

/// Thrown by `prepareSchema` for a file that a newer program made.
struct SchemaTooNew {
  std::int64_t version = 0;
};

/// What is stored about the database itself.
namespace meta {
inline constexpr const char* kIdentity = "identity";
inline constexpr const char* kRank = "rank";
inline constexpr const char* kOldestRank = "oldestRank";    ///< see Database::oldestAnswerableRank
inline constexpr const char* kIsComplete = "isComplete";    ///< 1 once a whole scan is stored
inline constexpr const char* kStampedUpTo = "stampedUpTo";  ///< see Scanner::stampSome
inline constexpr const char* kSweptUpTo = "sweptUpTo";      ///< see ContentJobs::sweep
inline constexpr const char* kThumbnailsSweptUpTo = "thumbnailsSweptUpTo";  ///< as above
/// There was nobody to draw: all documents are looked at again at the next start.
inline constexpr const char* kThumbnailsMissed = "thumbnailsMissed";
/// See DocumentDrawer::abilities; of when the documents were last looked through.
inline constexpr const char* kThumbnailAbilities = "thumbnailAbilities";
inline constexpr const char* kLastAccount = "lastAccount";  ///< key of who was signed in last
inline constexpr const char* kCollectedAt = "collectedAt";  ///< see StoreUpkeep; ns since the epoch
}  // namespace meta

/// Makes the tables in an empty file; brings those of an older version up to date; makes sort keys
/// of another collation version anew. Throws SQLite::Exception or SchemaTooNew.
void prepareSchema(Connection& connection);

/// The tables without the items' indexes, for a bulk load, and then the indexes.
void createTables(Connection& connection);
void createIndexes(Connection& connection);

[[nodiscard]] std::int64_t metaInteger(Connection& connection, const char* key);
void setMetaInteger(Connection& connection, const char* key, std::int64_t value);

/// A rank that no earlier database of this drive has reached: ranks start at the time of creation
/// in microseconds, and changes come slower than that.
[[nodiscard]] std::uint64_t initialRank();

}  // namespace yomber
