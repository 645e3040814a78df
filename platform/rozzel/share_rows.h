#pragma once

#include <string>
#include <vector>

#include "platform/rozzel/record_batch.h"
#include "platform/rozzel/share.h"
#include "platform/rozzel/zone_rows.h"

namespace yomber {

// Failures are StoreFailure, here and below.

/// The share of a zone as whoever looked the zone up sees it. Throws RZErrorUnknownItem.
[[nodiscard]] RZShareRef readShare(RecordsConnection& connection, const ZoneRow& zone);

/// Who takes part after an owner's save of `wanted`, when the store had `stored` before.
[[nodiscard]] std::vector<RZShareParticipant> settledParticipants(
    const std::vector<RZShareParticipant>& stored, const RZShare& wanted);

/// Changes shares, and who sees their zones, within a write transaction of its caller's, who
/// commits it. Throws StoreFailure; the transaction must then be rolled back.
class ShareWriter {
 public:
  explicit ShareWriter(const BatchWriter::Surroundings& surroundings);

  /// `database` is the owner's.
  RZShareRef save(const RZDatabaseID& database, const RZShare& share);
  void destroy(const RZDatabaseID& database, const RZShare& share);
  /// `database` is the participant's.
  void leave(const RZDatabaseID& database, const RZRecordZoneID& zoneID);
  RZShareRef accept(const std::string& containerIdentifier, const std::string& accountName,
                    const std::string& url);

 private:
  /// A zone in the hands of its owner, whoever it is that asked.
  struct OwnZone {
    RZDatabaseID database;
    ZoneRow zone;
  };
  [[nodiscard]] OwnZone zoneOfToken(const std::string& containerIdentifier, const std::string& url);
  [[nodiscard]] OwnZone inOwnersHands(const RZDatabaseID& database, const ZoneRow& zone);
  RZShareRef store(const OwnZone& own, const RZShare& share);
  void admit(const OwnZone& own, const RZShare& share, const std::string& accountName);

  RecordsConnection& connection_;
  BatchWriter::Surroundings surroundings_;
};

}  // namespace yomber
