#pragma once

#include <cstdint>

#include "zarn/connection.h"

namespace yomber {

/// The tables of uploads, downloads and evictions.
extern const char* const kContentTables;
extern const char* const kFailedJobsIndex;
extern const char* const kThumbnailTable;
extern const char* const kShareTables;
extern const char* const kShareWaitingTimes;
extern const char* const kSavingTable;

/// Brings tables of version `from` to version `to`, one version after the other, inside the
/// caller's transaction. Throws SQLite::Exception.
void migrateSchema(Connection& connection, std::int64_t from, std::int64_t to);

}  // namespace yomber
