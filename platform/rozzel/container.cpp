#include "platform/rozzel/container.h"

#include <utility>

#include "platform/rozzel/fetch_records_operation.h"

namespace yomber {
namespace {

/// Never destroyed: operations may still run while the process ends.
AtomicCell<std::function<RZContainer::Session()>>& sessionSource() {
  static auto& source = *new AtomicCell<std::function<RZContainer::Session()>>;
  return source;
}

}  // namespace

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

NSErrorRef RZDatabase::saveShare(const RZShare& share, RZShareRef& saved) {
  return engine_->saveShare(databaseID_, share, saved);
}

NSErrorRef RZDatabase::destroyShare(const RZShare& share) {
  return engine_->destroyShare(databaseID_, share);
}

NSErrorRef RZDatabase::fetchShare(const RZRecordZoneID& zoneID, RZShareRef& share) {
  return engine_->fetchShare(databaseID_, zoneID, share);
}

void RZDatabase::addOperation(const std::shared_ptr<RZFetchRecordsOperation>& operation) {
  operation->prepare(engine_, databaseID_);
  operations_.addOperation(operation);
}

std::string RZDatabase::description() const {
  const char* const scope = databaseID_.scope == RZDatabaseScope::Private ? "private" : "shared";
  return std::string(scope) + " database of " + databaseID_.containerIdentifier;
}

void RZContainer::setSessionSource(std::function<Session()> source) {
  sessionSource().store(std::move(source));
}

std::shared_ptr<RZContainer> RZContainer::containerWithIdentifier(const std::string& identifier) {
  const auto source = sessionSource().load();
  Session session = source ? source() : Session{};
  return std::make_shared<RZContainer>(session.engine, identifier, std::move(session.accountName));
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

NSErrorRef RZContainer::acceptShare(const std::string& url, RZShareRef& share) const {
  return private_->engine()->acceptShare(containerIdentifier_, accountName_, url, share);
}

std::string RZContainer::description() const { return "container " + containerIdentifier_; }

}  // namespace yomber
