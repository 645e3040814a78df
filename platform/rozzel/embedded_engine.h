#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>

#include "platform/foundation/date.h"
#include "platform/rozzel/engine.h"

namespace yomber {

struct EmbeddedEngineOptions {
  /// The store's clock. Empty: the machine's.
  std::function<NSDate()> clock = {};
  /// How long an asset that nobody refers to is kept: as long as users expect what they have
  /// removed, or moved out of the drive without its content, to be had back.
  std::int64_t assetGraceSeconds = std::int64_t{30} * 24 * 3600;
  /// How many deletions a zone remembers for its change feed.
  std::size_t maximumTombstones = 100000;
  /// How long a call waits for other processes' writes before RZErrorStoreBusy.
  int busyMilliseconds = 10000;
};

/// The record store in a folder of this machine: `records.db` (SQLite) and `assets/`, named by
/// hash. Serves one Unix user; the accounts in it trust each other.
///
/// The folder is out of reach while it, its database or the right to use them is missing, and while
/// it holds a file called `offline`. It may go away and come back at any time.
///
/// Ownership: shared by all who use the store in this process. Thread-safety: as RZEngine says.
/// Instances and processes on one folder do not disturb each other. Never carried across `fork`.
class EmbeddedEngine final : public RZEngine {
 public:
  /// Makes the store in `folder` if there is none there; its parent must exist. This is the only
  /// call that makes one: a store that is missing later is out of reach, not empty.
  [[nodiscard]] static NSErrorRef create(const std::string& folder);

  /// Touches nothing yet; each call finds the store or fails with RZErrorNetworkUnavailable.
  explicit EmbeddedEngine(std::string folder, EmbeddedEngineOptions options = {});
  ~EmbeddedEngine() override;

  [[nodiscard]] NSErrorRef checkReachability() override;
  [[nodiscard]] NSErrorRef createZone(const RZDatabaseID& database,
                                      const RZRecordZoneID& zoneID) override;
  [[nodiscard]] NSErrorRef deleteZone(const RZDatabaseID& database,
                                      const RZRecordZoneID& zoneID) override;
  [[nodiscard]] NSErrorRef fetchZones(const RZDatabaseID& database,
                                      std::vector<RZRecordZone>& zones) override;
  [[nodiscard]] NSErrorRef fetchRecords(const RZDatabaseID& database,
                                        const std::vector<RZRecordID>& recordIDs,
                                        const RZDesiredKeys& desiredKeys,
                                        std::vector<RZFetchedRecord>& records) override;
  [[nodiscard]] NSErrorRef modifyRecords(const RZDatabaseID& database, const RZRecordBatch& batch,
                                         std::vector<RZRecordRef>& saved) override;
  [[nodiscard]] NSErrorRef fetchChanges(const RZDatabaseID& database, const RZRecordZoneID& zoneID,
                                        const RZChangeToken& token, std::size_t limit,
                                        const RZDesiredKeys& desiredKeys,
                                        RZChangePage& page) override;
  [[nodiscard]] NSErrorRef queryRecords(const RZDatabaseID& database, const RZQuery& query,
                                        const std::string& cursor, std::size_t limit,
                                        RZQueryPage& page) override;
  [[nodiscard]] NSErrorRef addMember(const RZDatabaseID& database, const RZRecordZoneID& zoneID,
                                     const RZZoneMember& member) override;
  [[nodiscard]] NSErrorRef removeMember(const RZDatabaseID& database, const RZRecordZoneID& zoneID,
                                        const std::string& accountName) override;
  [[nodiscard]] NSErrorRef fetchMembers(const RZDatabaseID& database, const RZRecordZoneID& zoneID,
                                        std::vector<RZZoneMember>& members) override;
  [[nodiscard]] NSErrorRef saveShare(const RZDatabaseID& database, const RZShare& share,
                                     RZShareRef& saved) override;
  [[nodiscard]] NSErrorRef destroyShare(const RZDatabaseID& database,
                                        const RZShare& share) override;
  [[nodiscard]] NSErrorRef fetchShare(const RZDatabaseID& database, const RZRecordZoneID& zoneID,
                                      RZShareRef& share) override;
  [[nodiscard]] NSErrorRef acceptShare(const std::string& containerIdentifier,
                                       const std::string& accountName, const std::string& url,
                                       RZShareRef& share) override;
  [[nodiscard]] NSErrorRef setQuota(const std::string& accountName,
                                    std::optional<std::uint64_t> limit) override;
  [[nodiscard]] NSErrorRef fetchQuota(const std::string& accountName, RZQuota& quota) override;
  [[nodiscard]] std::unique_ptr<RZAssetGroup> newAssetGroup(NSErrorRef* error) override;
  [[nodiscard]] NSErrorRef openAsset(const RZAsset& asset, FileDescriptor& descriptor) override;
  [[nodiscard]] NSErrorRef localFile(const RZAsset& asset, std::string& path) override;
  [[nodiscard]] NSErrorRef copyAsset(const RZAsset& asset, int descriptor,
                                     const RZTransfer& transfer) override;
  [[nodiscard]] NSErrorRef readAsset(const RZAsset& asset, std::uint64_t maximumSize,
                                     std::string& bytes) override;
  [[nodiscard]] NSErrorRef verifyAsset(const RZAsset& asset, const RZTransfer& transfer) override;
  [[nodiscard]] NSErrorRef collectGarbage(RZGarbageReport& report) override;

 private:
  class Store;
  const std::unique_ptr<Store> store_;
};

}  // namespace yomber
