#include "platform/rozzel/container.h"

#include <utility>

namespace yomber {

RZDatabase::RZDatabase(RZEngineRef engine, RZDatabaseID databaseID)
    : engine_(std::move(engine)), databaseID_(std::move(databaseID)) {}

NSErrorRef RZDatabase::createZone(const RZRecordZoneID& zoneID) {
  return engine_->createZone(databaseID_, zoneID);
}

NSErrorRef RZDatabase::deleteZone(const RZRecordZoneID& zoneID) {
  return engine_->deleteZone(databaseID_, zoneID);
}

NSErrorRef RZDatabase::fetchZones(std::vector<RZRecordZone>& zones) {
  return engine_->fetchZones(databaseID_, zones);
}

NSErrorRef RZDatabase::fetchRecords(const std::vector<RZRecordID>& recordIDs,
                                    const RZDesiredKeys& desiredKeys,
                                    std::vector<RZFetchedRecord>& records) {
  return engine_->fetchRecords(databaseID_, recordIDs, desiredKeys, records);
}

RZRecordRef RZDatabase::fetchRecord(const RZRecordID& recordID, NSErrorRef* error) {
  std::vector<RZFetchedRecord> records;
  NSErrorRef failure = fetchRecords({recordID}, std::nullopt, records);
  if (!failure) failure = records.front().error;
  if (!failure) return records.front().record;
  storeError(error, failure);
  return nullptr;
}

NSErrorRef RZDatabase::modifyRecords(const RZRecordBatch& batch, std::vector<RZRecordRef>& saved) {
  return engine_->modifyRecords(databaseID_, batch, saved);
}

NSErrorRef RZDatabase::fetchChanges(const RZRecordZoneID& zoneID, const RZChangeToken& token,
                                    std::size_t limit, const RZDesiredKeys& desiredKeys,
                                    RZChangePage& page) {
  return engine_->fetchChanges(databaseID_, zoneID, token, limit, desiredKeys, page);
}

NSErrorRef RZDatabase::queryRecords(const RZQuery& query, const std::string& cursor,
                                    std::size_t limit, RZQueryPage& page) {
  return engine_->queryRecords(databaseID_, query, cursor, limit, page);
}

std::string RZDatabase::description() const {
  const char* const scope = databaseID_.scope == RZDatabaseScope::Private ? "private" : "shared";
  return std::string(scope) + " database of " + databaseID_.containerIdentifier;
}

RZContainer::RZContainer(const RZEngineRef& engine, std::string containerIdentifier,
                         std::string accountName)
    : containerIdentifier_(std::move(containerIdentifier)),
      accountName_(std::move(accountName)),
      private_(std::make_shared<RZDatabase>(
          engine, RZDatabaseID{containerIdentifier_, accountName_, RZDatabaseScope::Private})),
      shared_(std::make_shared<RZDatabase>(
          engine, RZDatabaseID{containerIdentifier_, accountName_, RZDatabaseScope::Shared})) {}

const RZDatabaseRef& RZContainer::databaseForZone(const RZRecordZoneID& zoneID) const {
  const bool own =
      zoneID.ownerName() == RZCurrentUserDefaultName || zoneID.ownerName() == accountName_;
  return own ? private_ : shared_;
}

std::string RZContainer::description() const { return "container " + containerIdentifier_; }

}  // namespace yomber
