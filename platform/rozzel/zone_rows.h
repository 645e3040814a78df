#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "platform/rozzel/engine.h"
#include "platform/rozzel/records_connection.h"

namespace yomber {

/// A living zone as the database has it.
struct ZoneRow {
  std::int64_t id = 0;
  std::int64_t sequence = 0;
  std::int64_t forgotten = 0;
  std::int64_t tombstones = 0;
  std::int64_t charge = 0;
  std::string owner;
  /// As the account that asked sees it.
  RZRecordZoneID zoneID;
  RZZonePermission permission = RZZonePermission::ReadWrite;
};

// Failures are StoreFailure, here and below.

/// Refuses names of containers, accounts, zones that no store takes, and zones that cannot be in
/// that database. Answers the zone's id with its owner written the usual way.
[[nodiscard]] RZRecordZoneID checkedZoneID(const RZDatabaseID& database,
                                           const RZRecordZoneID& zoneID);
void checkDatabase(const RZDatabaseID& database);
/// Refuses an empty name and one that is too long; `what` says whose it is.
void checkName(const std::string& name, const char* what);

/// None: the account sees no such zone in that database.
[[nodiscard]] std::optional<ZoneRow> findZone(RecordsConnection& connection,
                                              const RZDatabaseID& database,
                                              const RZRecordZoneID& zoneID);
/// Throws RZErrorZoneNotFound instead.
[[nodiscard]] ZoneRow requireZone(RecordsConnection& connection, const RZDatabaseID& database,
                                  const RZRecordZoneID& zoneID);

[[nodiscard]] std::vector<RZRecordZone> listZones(RecordsConnection& connection,
                                                  const RZDatabaseID& database);
/// Within a write transaction, as everything below.
void insertZone(RecordsConnection& connection, const RZDatabaseID& database,
                const RZRecordZoneID& zoneID);
void killZone(RecordsConnection& connection, const ZoneRow& zone);
void updateZone(RecordsConnection& connection, const ZoneRow& zone);

void insertMember(RecordsConnection& connection, const ZoneRow& zone, const RZZoneMember& member);
void deleteMember(RecordsConnection& connection, const ZoneRow& zone,
                  const std::string& accountName);
void deleteMembers(RecordsConnection& connection, const ZoneRow& zone);
[[nodiscard]] std::vector<RZZoneMember> listMembers(RecordsConnection& connection,
                                                    const ZoneRow& zone);

/// The bytes charged to all zones of an owner.
[[nodiscard]] std::int64_t chargeOfOwner(RecordsConnection& connection, const std::string& owner);
[[nodiscard]] std::optional<std::uint64_t> quotaOfOwner(RecordsConnection& connection,
                                                        const std::string& owner);
void storeQuota(RecordsConnection& connection, const std::string& owner,
                std::optional<std::uint64_t> limit);

/// The tag of a change: differs between any two changes in a store.
[[nodiscard]] std::string changeTagFor(std::int64_t zone, std::int64_t sequence);

}  // namespace yomber
