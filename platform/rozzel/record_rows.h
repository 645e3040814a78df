#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "platform/rozzel/engine.h"
#include "platform/rozzel/records_connection.h"
#include "platform/rozzel/zone_rows.h"

namespace yomber {

/// A record as the database has it.
struct RecordRow {
  std::int64_t id = 0;
  std::int64_t sequence = 0;
  std::int64_t charge = 0;
  RZRecordRef record;
  bool isDamaged = false;  ///< its values cannot be read: the record has none
};

// Failures are StoreFailure, here and below.

[[nodiscard]] std::optional<RecordRow> findRecord(RecordsConnection& connection,
                                                  const ZoneRow& zone, const std::string& name,
                                                  const RZDesiredKeys& desiredKeys);

/// The same with all values, for changing it: a damaged one is found as well.
[[nodiscard]] std::optional<RecordRow> findRecordToChange(RecordsConnection& connection,
                                                          const ZoneRow& zone,
                                                          const std::string& name);

[[nodiscard]] std::vector<RZFetchedRecord> readRecords(RecordsConnection& connection,
                                                       const RZDatabaseID& database,
                                                       const std::vector<RZRecordID>& recordIDs,
                                                       const RZDesiredKeys& desiredKeys);

[[nodiscard]] RZChangePage readChanges(RecordsConnection& connection, const ZoneRow& zone,
                                       const RZChangeToken& token, std::size_t limit,
                                       const RZDesiredKeys& desiredKeys);

[[nodiscard]] RZQueryPage readQueryPage(RecordsConnection& connection, const ZoneRow& zone,
                                        const RZQuery& query, const std::string& cursor,
                                        std::size_t limit);

}  // namespace yomber
