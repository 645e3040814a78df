#pragma once

#include <cstdint>

#include "platform/rozzel/records_connection.h"

namespace yomber {

/// The version of the database's form that this program writes.
[[nodiscard]] std::int64_t recordsSchemaVersion();

/// Makes the tables in a new, empty database; one that has them already is left as it is. Failures
/// are StoreFailure, here and below.
void createRecordsSchema(RecordsConnection& connection);

/// Makes a database that was just opened fit for use: refuses what is no record store or too new,
/// without changing it, and brings an older one up to date, one version a transaction.
void prepareRecordsSchema(RecordsConnection& connection);

}  // namespace yomber
