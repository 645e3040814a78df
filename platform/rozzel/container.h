#pragma once

#include <cstddef>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "platform/foundation/atomic_cell.h"
#include "platform/foundation/object.h"
#include "platform/foundation/operation.h"
#include "platform/rozzel/engine.h"

namespace yomber {

class RZFetchRecordsOperation;

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
  [[nodiscard]] NSErrorRef saveShare(const RZShare& share, RZShareRef& saved);
  [[nodiscard]] NSErrorRef destroyShare(const RZShare& share);
  [[nodiscard]] NSErrorRef fetchShare(const RZRecordZoneID& zoneID, RZShareRef& share);

  /// Runs the operation on this database, on a queue of the database's own. An operation is added
  /// once.
  void addOperation(const std::shared_ptr<RZFetchRecordsOperation>& operation);

  [[nodiscard]] std::string description() const override;

 private:
  const RZEngineRef engine_;
  const RZDatabaseID databaseID_;
  NSOperationQueue operations_;
};

using RZDatabaseRef = std::shared_ptr<RZDatabase>;

/// What one account has in one container: a private and a shared database.
///
/// Ownership: shared. Thread-safety: every operation may be called on any thread.
class RZContainer final : public NSObject {
 public:
  /// The store that a process uses, and the account that is signed in to it; empty: nobody is.
  struct Session {
    RZEngineRef engine;
    std::string accountName = {};
  };
  /// Says where `containerWithIdentifier` finds its session. Called whenever a container is asked
  /// for, on the asking thread; it may block. Set once, before any container is asked for.
  static void setSessionSource(std::function<Session()> source);
  /// A container of the process's store as it is now: it does not follow the account. When nobody
  /// is signed in, or the process has no store, its operations fail with RZErrorNotAuthenticated.
  [[nodiscard]] static std::shared_ptr<RZContainer> containerWithIdentifier(
      const std::string& identifier);

  /// An empty account name is that of nobody.
  RZContainer(const RZEngineRef& engine, std::string containerIdentifier, std::string accountName);

  [[nodiscard]] const std::string& containerIdentifier() const { return containerIdentifier_; }
  [[nodiscard]] const std::string& accountName() const { return accountName_; }
  /// On whose behalf operations run that do not say so themselves; for logs.
  void setSourceApplicationBundleIdentifier(std::string identifier) {
    sourceApplication_.store(std::move(identifier));
  }
  [[nodiscard]] std::string sourceApplicationBundleIdentifier() const {
    return sourceApplication_.load();
  }
  [[nodiscard]] const RZDatabaseRef& privateCloudDatabase() const { return private_; }
  [[nodiscard]] const RZDatabaseRef& sharedCloudDatabase() const { return shared_; }
  /// The database that has the zone: the private one for zones of the account itself.
  [[nodiscard]] const RZDatabaseRef& databaseForZone(const RZRecordZoneID& zoneID) const;
  /// Accepts the share with that URL for the account; see RZEngine.
  [[nodiscard]] NSErrorRef acceptShare(const std::string& url, RZShareRef& share) const;

  [[nodiscard]] std::string description() const override;

 private:
  const std::string containerIdentifier_;
  const std::string accountName_;
  const RZDatabaseRef private_;
  const RZDatabaseRef shared_;
  AtomicCell<std::string> sourceApplication_;
};

using RZContainerRef = std::shared_ptr<RZContainer>;

}  // namespace yomber
