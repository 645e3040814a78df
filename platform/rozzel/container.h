#pragma once

#include <cstddef>
#include <memory>
#include <string>
#include <vector>

#include "platform/foundation/object.h"
#include "platform/rozzel/engine.h"

namespace yomber {

/// One database of a container, as one account sees it: an engine's calls without saying where.
/// See RZEngine for what each does.
///
/// Ownership: shared; keeps its engine. Thread-safety: every operation may be called on any thread.
class RZDatabase final : public NSObject {
 public:
  RZDatabase(RZEngineRef engine, RZDatabaseID databaseID);

  [[nodiscard]] const RZDatabaseID& databaseID() const { return databaseID_; }
  [[nodiscard]] RZDatabaseScope databaseScope() const { return databaseID_.scope; }
  [[nodiscard]] const RZEngineRef& engine() const { return engine_; }

  [[nodiscard]] NSErrorRef createZone(const RZRecordZoneID& zoneID);
  [[nodiscard]] NSErrorRef deleteZone(const RZRecordZoneID& zoneID);
  [[nodiscard]] NSErrorRef fetchZones(std::vector<RZRecordZone>& zones);
  [[nodiscard]] NSErrorRef fetchRecords(const std::vector<RZRecordID>& recordIDs,
                                        const RZDesiredKeys& desiredKeys,
                                        std::vector<RZFetchedRecord>& records);
  /// The record, or nil and its error.
  [[nodiscard]] RZRecordRef fetchRecord(const RZRecordID& recordID, NSErrorRef* error = nullptr);
  [[nodiscard]] NSErrorRef modifyRecords(const RZRecordBatch& batch,
                                         std::vector<RZRecordRef>& saved);
  [[nodiscard]] NSErrorRef fetchChanges(const RZRecordZoneID& zoneID, const RZChangeToken& token,
                                        std::size_t limit, const RZDesiredKeys& desiredKeys,
                                        RZChangePage& page);
  [[nodiscard]] NSErrorRef queryRecords(const RZQuery& query, const std::string& cursor,
                                        std::size_t limit, RZQueryPage& page);

  [[nodiscard]] std::string description() const override;

 private:
  const RZEngineRef engine_;
  const RZDatabaseID databaseID_;
};

using RZDatabaseRef = std::shared_ptr<RZDatabase>;

/// What one account has in one container: a private and a shared database.
///
/// Ownership: shared. Thread-safety: immutable after construction.
class RZContainer final : public NSObject {
 public:
  RZContainer(const RZEngineRef& engine, std::string containerIdentifier, std::string accountName);

  [[nodiscard]] const std::string& containerIdentifier() const { return containerIdentifier_; }
  [[nodiscard]] const std::string& accountName() const { return accountName_; }
  [[nodiscard]] const RZDatabaseRef& privateCloudDatabase() const { return private_; }
  [[nodiscard]] const RZDatabaseRef& sharedCloudDatabase() const { return shared_; }
  /// The database that has the zone: the private one for zones of the account itself.
  [[nodiscard]] const RZDatabaseRef& databaseForZone(const RZRecordZoneID& zoneID) const;

  [[nodiscard]] std::string description() const override;

 private:
  const std::string containerIdentifier_;
  const std::string accountName_;
  const RZDatabaseRef private_;
  const RZDatabaseRef shared_;
};

using RZContainerRef = std::shared_ptr<RZContainer>;

}  // namespace yomber
