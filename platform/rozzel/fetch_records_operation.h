#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "platform/foundation/operation.h"
#include "platform/rozzel/engine.h"
#include "platform/rozzel/operation_group.h"

namespace yomber {

/// How urgent an operation is. Engines without a network treat all of them alike.
enum class NSQualityOfService : std::uint8_t { Background = 9, Utility = 17, UserInitiated = 25 };

/// How an operation uses the network.
class RZOperationConfiguration {
 public:
  /// 0: at once, whatever the network costs.
  [[nodiscard]] int discretionaryNetworkBehavior() const { return discretionaryNetworkBehavior_; }
  void setDiscretionaryNetworkBehavior(int behavior) { discretionaryNetworkBehavior_ = behavior; }
  [[nodiscard]] bool automaticallyRetryNetworkFailures() const { return retries_; }
  void setAutomaticallyRetryNetworkFailures(bool retries) { retries_ = retries; }
  /// On whose behalf the operation runs; for logs.
  [[nodiscard]] const std::string& sourceApplicationBundleIdentifier() const {
    return sourceApplication_;
  }
  void setSourceApplicationBundleIdentifier(std::string identifier) {
    sourceApplication_ = std::move(identifier);
  }

 private:
  int discretionaryNetworkBehavior_ = 0;
  bool retries_ = false;
  std::string sourceApplication_;
};

/// Fetches records of one database, and hands each one over as soon as it was read.
///
/// Records are read a few hundred at a time, so that memory does not grow with the number of ids.
/// Their assets are not copied: `RZRecord::assetFile` names the store's own file. A store that
/// cannot be reached fails the records that are left, each with that error, and the operation. A
/// record that is not there fails alone; any other failure of a record fails the operation too, and
/// the first one is the operation's. Once it was cancelled, no further record is handed over.
///
/// Ownership: shared; its database's queue keeps it until it is finished, and the handlers are let
/// go of then.
/// Thread-safety: set up by one thread before it is added to a database; `cancel` may be called on
/// any thread. Handlers run on a thread of the pool, one at a time, and may block.
class RZFetchRecordsOperation final : public NSOperation {
 public:
  using PerRecordBlock =
      std::function<void(const RZRecordRef& record, const RZRecordID& recordID, NSErrorRef error)>;
  using CompletionBlock = std::function<void(NSErrorRef operationError)>;

  void setRecordIDs(std::vector<RZRecordID> recordIDs) { recordIDs_ = std::move(recordIDs); }
  [[nodiscard]] const std::vector<RZRecordID>& recordIDs() const { return recordIDs_; }
  /// Nil: all keys.
  void setDesiredKeys(RZDesiredKeys keys) { desiredKeys_ = std::move(keys); }
  [[nodiscard]] const RZDesiredKeys& desiredKeys() const { return desiredKeys_; }
  void setQualityOfService(NSQualityOfService quality) { quality_ = quality; }
  [[nodiscard]] NSQualityOfService qualityOfService() const { return quality_; }
  [[nodiscard]] RZOperationConfiguration& configuration() { return configuration_; }
  void setGroup(RZOperationGroupRef group) { group_ = std::move(group); }
  [[nodiscard]] const RZOperationGroupRef& group() const { return group_; }

  /// Called once for each id, with the record or with why there is none. An id that is given twice
  /// counts twice.
  void setPerRecordCompletionBlock(PerRecordBlock block) { perRecord_ = std::move(block); }
  /// Called once, when everything else has been, also for an operation that was cancelled before
  /// it began: then, as for every cancelled one, with NSUserCancelledError. It takes the place of
  /// the completion block that every operation has.
  void setFetchRecordsCompletionBlock(CompletionBlock block) { completion_ = std::move(block); }

  [[nodiscard]] std::string description() const override;

 protected:
  void main() override;

 private:
  friend class RZDatabase;

  /// For the database that is going to run it.
  void prepare(RZEngineRef engine, RZDatabaseID database);
  void fetchAll();
  void fetchPart(std::size_t begin, std::size_t end);
  void handOver(RZFetchedRecord fetched);
  void noteFailure(const NSErrorRef& error);
  [[nodiscard]] RZRecordRef withAssetFiles(const RZRecordRef& record) const;
  void complete();

  std::vector<RZRecordID> recordIDs_;
  RZDesiredKeys desiredKeys_;
  NSQualityOfService quality_ = NSQualityOfService::Utility;
  RZOperationConfiguration configuration_;
  RZOperationGroupRef group_;
  PerRecordBlock perRecord_;
  CompletionBlock completion_;

  // Of the database, once it was added.
  RZEngineRef engine_;
  RZDatabaseID database_;

  // Of the thread that runs it.
  NSErrorRef storeFailure_;  ///< why the rest is not asked for
  NSErrorRef failure_;
};

}  // namespace yomber
