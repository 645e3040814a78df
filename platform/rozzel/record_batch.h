#pragma once

#include <cstddef>
#include <cstdint>
#include <map>
#include <set>
#include <string>
#include <vector>

#include "platform/foundation/date.h"
#include "platform/rozzel/asset_folder.h"
#include "platform/rozzel/engine.h"
#include "platform/rozzel/record_rows.h"
#include "platform/rozzel/records_connection.h"
#include "platform/rozzel/zone_rows.h"

namespace yomber {

/// What can be seen of a batch without the store: sizes, names, doubles. Throws StoreFailure.
void checkBatch(const RZDatabaseID& database, const RZRecordBatch& batch);

/// Carries out one batch within a write transaction of its caller's, who commits it. Throws
/// StoreFailure; the transaction must then be rolled back.
class BatchWriter {
 public:
  struct Surroundings {
    RecordsConnection& connection;
    const AssetFolder& assets;
    NSDate now;
    std::size_t maximumTombstones;
    /// Whether records that are shares may be deleted.
    bool mayDeleteShares = false;
  };

  BatchWriter(const Surroundings& surroundings, const RZDatabaseID& database);
  /// Answers the saved records as they now are.
  std::vector<RZRecordRef> write(const RZRecordBatch& batch);

 private:
  ZoneRow& writableZone(const RZRecordZoneID& zoneID);
  RZRecordRef save(const RZRecord& record, RZRecordSavePolicy policy);
  RZRecordRef insert(ZoneRow& zone, const RZRecord& record);
  RZRecordRef update(ZoneRow& zone, const RecordRow& row, const RZRecord& record,
                     RZRecordSavePolicy policy);
  void remove(const RZRecordDeletion& deletion);
  void addTombstone(ZoneRow& zone, const RZRecord& record);
  void removeTombstone(ZoneRow& zone, const std::string& name);
  void forgetOldDeletions(ZoneRow& zone);
  void useAssets(const std::vector<RZAsset>& added, const std::vector<RZAsset>& released);
  void checkQuotas();

  RecordsConnection& connection_;
  const AssetFolder& assets_;
  const NSDate now_;
  const std::size_t maximumTombstones_;
  const bool mayDeleteShares_;
  const RZDatabaseID& database_;
  std::map<RZRecordZoneID, ZoneRow> zones_;
  std::map<std::string, std::int64_t> chargesBefore_;
};

/// What a save is refused with when the store has another version of the record.
[[noreturn]] void throwChanged(const RecordRow& row);

/// One use of an asset less. Shared with what clears deleted zones away.
void releaseAsset(RecordsConnection& connection, const RZAsset& asset, NSDate now);

}  // namespace yomber
