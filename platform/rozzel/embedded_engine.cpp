#include "platform/rozzel/embedded_engine.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <utility>

#include "platform/foundation/fault_points.h"
#include "platform/rozzel/asset_garbage.h"
#include "platform/rozzel/embedded_store.h"
#include "platform/rozzel/hashed_copy.h"
#include "platform/rozzel/record_batch.h"
#include "platform/rozzel/record_rows.h"
#include "platform/rozzel/sha256.h"
#include "platform/rozzel/share_rows.h"
#include "platform/rozzel/sparse_file.h"
#include "platform/rozzel/stream_hasher.h"
#include "platform/rozzel/verified_copy.h"
#include "platform/rozzel/zone_rows.h"

namespace yomber {

namespace {

using Kind = RecordsTransaction::Kind;

FaultPoint whenBegun("rozzel.batch.begun");
FaultPoint whenWritten("rozzel.batch.written");
FaultPoint whenCommitted("rozzel.batch.committed");
FaultPoint whenShareWritten("rozzel.share.written");

void pass(FaultPoint& point) {
  if (point.hit()) throwErrno("saving records was told to fail", ENOSPC);
}

void requireOwner(const RZDatabaseID& database) {
  if (database.scope != RZDatabaseScope::Private) {
    throwFailure(RZErrorPermissionFailure, "only a zone's owner may do that");
  }
}

bool isReadable(int descriptor) {
  const int flags = fcntl(descriptor, F_GETFL);
  return flags >= 0 && (flags & O_ACCMODE) == O_RDWR;
}

NSErrorRef writtenToMeanwhile() {
  return NSError::errorWithDomain(
      NSPOSIXErrorDomain, EAGAIN,
      {{NSLocalizedDescriptionKey,
        std::string("somebody else wrote to the file while it was filled; try again")}});
}

std::string parentOf(const std::string& folder) {
  return std::filesystem::absolute(folder).lexically_normal().parent_path();
}

void makeDatabase(const std::string& folder) {
  constexpr int kBusyMilliseconds = 10000;
  RecordsConnection connection(folder + "/records.db", RecordsConnection::Missing::Create,
                               kBusyMilliseconds);
  createRecordsSchema(connection);
  prepareRecordsSchema(connection);
}

/// `store` is a template because the store's class is private to the engine.
template <typename Store>
BatchWriter::Surroundings surroundings(Store& store, RecordsConnection& connection) {
  return {.connection = connection,
          .assets = store.assets(),
          .now = store.now(),
          .maximumTombstones = store.options().maximumTombstones};
}

}  // namespace

NSErrorRef EmbeddedEngine::create(const std::string& folder) {
  return catchingFailures([&] {
    const bool made = mkdir(folder.c_str(), 0700) == 0;
    if (!made && errno != EEXIST) throwErrno("cannot make " + folder);
    const AssetFolder assets(folder);
    const AssetLock lock(assets, AssetLock::Kind::Dropping);
    assets.create();
    makeDatabase(folder);
    syncStoreFolder(folder);
    if (made) syncStoreFolder(parentOf(folder));
  });
}

EmbeddedEngine::EmbeddedEngine(std::string folder, EmbeddedEngineOptions options)
    : store_(std::make_unique<Store>(std::move(folder), std::move(options))) {}

EmbeddedEngine::~EmbeddedEngine() = default;

NSErrorRef EmbeddedEngine::checkReachability() {
  return catchingFailures([&] { store_->requireReachable(); });
}

NSErrorRef EmbeddedEngine::createZone(const RZDatabaseID& database, const RZRecordZoneID& zoneID) {
  return store_->withTransaction(Kind::Write, [&](RecordsConnection& connection) {
    requireOwner(database);
    if (!findZone(connection, database, zoneID)) insertZone(connection, database, zoneID);
  });
}

NSErrorRef EmbeddedEngine::deleteZone(const RZDatabaseID& database, const RZRecordZoneID& zoneID) {
  return store_->withTransaction(Kind::Write, [&](RecordsConnection& connection) {
    requireOwner(database);
    const auto zone = findZone(connection, database, zoneID);
    if (zone) killZone(connection, *zone);
  });
}

NSErrorRef EmbeddedEngine::fetchZones(const RZDatabaseID& database,
                                      std::vector<RZRecordZone>& zones) {
  return store_->withConnection(
      [&](RecordsConnection& connection) { zones = listZones(connection, database); });
}

NSErrorRef EmbeddedEngine::fetchRecords(const RZDatabaseID& database,
                                        const std::vector<RZRecordID>& recordIDs,
                                        const RZDesiredKeys& desiredKeys,
                                        std::vector<RZFetchedRecord>& records) {
  return store_->withTransaction(Kind::Read, [&](RecordsConnection& connection) {
    records = readRecords(connection, database, recordIDs, desiredKeys);
  });
}

NSErrorRef EmbeddedEngine::modifyRecords(const RZDatabaseID& database, const RZRecordBatch& batch,
                                         std::vector<RZRecordRef>& saved) {
  if (NSErrorRef error = catchingFailures([&] { checkBatch(database, batch); })) return error;
  return store_->withConnection([&](RecordsConnection& connection) {
    RecordsTransaction transaction(connection, Kind::Write);
    pass(whenBegun);
    BatchWriter writer(surroundings(*store_, connection), database);
    std::vector<RZRecordRef> records = writer.write(batch);
    pass(whenWritten);
    transaction.commit();
    pass(whenCommitted);
    saved = std::move(records);
  });
}

NSErrorRef EmbeddedEngine::fetchChanges(const RZDatabaseID& database, const RZRecordZoneID& zoneID,
                                        const RZChangeToken& token, std::size_t limit,
                                        const RZDesiredKeys& desiredKeys, RZChangePage& page) {
  return store_->withTransaction(Kind::Read, [&](RecordsConnection& connection) {
    const ZoneRow zone = requireZone(connection, database, zoneID);
    page = readChanges(connection, zone, token, limit, desiredKeys);
  });
}

NSErrorRef EmbeddedEngine::queryRecords(const RZDatabaseID& database, const RZQuery& query,
                                        const std::string& cursor, std::size_t limit,
                                        RZQueryPage& page) {
  return store_->withTransaction(Kind::Read, [&](RecordsConnection& connection) {
    const ZoneRow zone = requireZone(connection, database, query.zoneID);
    page = readQueryPage(connection, zone, query, cursor, limit);
  });
}

NSErrorRef EmbeddedEngine::addMember(const RZDatabaseID& database, const RZRecordZoneID& zoneID,
                                     const RZZoneMember& member) {
  return store_->withTransaction(Kind::Write, [&](RecordsConnection& connection) {
    requireOwner(database);
    insertMember(connection, requireZone(connection, database, zoneID), member);
  });
}

NSErrorRef EmbeddedEngine::removeMember(const RZDatabaseID& database, const RZRecordZoneID& zoneID,
                                        const std::string& accountName) {
  return store_->withTransaction(Kind::Write, [&](RecordsConnection& connection) {
    requireOwner(database);
    deleteMember(connection, requireZone(connection, database, zoneID), accountName);
  });
}

NSErrorRef EmbeddedEngine::fetchMembers(const RZDatabaseID& database, const RZRecordZoneID& zoneID,
                                        std::vector<RZZoneMember>& members) {
  return store_->withTransaction(Kind::Read, [&](RecordsConnection& connection) {
    requireOwner(database);
    members = listMembers(connection, requireZone(connection, database, zoneID));
  });
}

NSErrorRef EmbeddedEngine::saveShare(const RZDatabaseID& database, const RZShare& share,
                                     RZShareRef& saved) {
  return store_->withConnection([&](RecordsConnection& connection) {
    requireOwner(database);
    RecordsTransaction transaction(connection, Kind::Write);
    RZShareRef stored = ShareWriter(surroundings(*store_, connection)).save(database, share);
    pass(whenShareWritten);
    transaction.commit();
    saved = std::move(stored);
  });
}

NSErrorRef EmbeddedEngine::destroyShare(const RZDatabaseID& database, const RZShare& share) {
  return store_->withTransaction(Kind::Write, [&](RecordsConnection& connection) {
    ShareWriter writer(surroundings(*store_, connection));
    if (database.scope == RZDatabaseScope::Private) {
      writer.destroy(database, share);
    } else {
      writer.leave(database, share.recordID().zoneID());
    }
    pass(whenShareWritten);
  });
}

NSErrorRef EmbeddedEngine::fetchShare(const RZDatabaseID& database, const RZRecordZoneID& zoneID,
                                      RZShareRef& share) {
  return store_->withTransaction(Kind::Read, [&](RecordsConnection& connection) {
    share = readShare(connection, requireZone(connection, database, zoneID));
  });
}

NSErrorRef EmbeddedEngine::acceptShare(const std::string& containerIdentifier,
                                       const std::string& accountName, const std::string& url,
                                       RZShareRef& share) {
  return store_->withConnection([&](RecordsConnection& connection) {
    RecordsTransaction transaction(connection, Kind::Write);
    RZShareRef accepted = ShareWriter(surroundings(*store_, connection))
                              .accept(containerIdentifier, accountName, url);
    pass(whenShareWritten);
    transaction.commit();
    share = std::move(accepted);
  });
}

NSErrorRef EmbeddedEngine::setQuota(const std::string& accountName,
                                    std::optional<std::uint64_t> limit) {
  return store_->withTransaction(Kind::Write, [&](RecordsConnection& connection) {
    checkName(accountName, "the name of an account");
    storeQuota(connection, accountName, limit);
  });
}

NSErrorRef EmbeddedEngine::fetchQuota(const std::string& accountName, RZQuota& quota) {
  return store_->withTransaction(Kind::Read, [&](RecordsConnection& connection) {
    checkName(accountName, "the name of an account");
    quota.limit = quotaOfOwner(connection, accountName);
    quota.used = static_cast<std::uint64_t>(chargeOfOwner(connection, accountName));
  });
}

std::unique_ptr<RZAssetGroup> EmbeddedEngine::newAssetGroup(NSErrorRef* error) {
  std::unique_ptr<RZAssetGroup> group;
  storeError(error, catchingFailures([&] {
               group = std::make_unique<StagedGroup>(
                   store_->assets(), store_->session(), [this] { return store_->now(); },
                   [this] { return checkReachability(); });
             }));
  return group;
}

NSErrorRef EmbeddedEngine::openAsset(const RZAsset& asset, FileDescriptor& descriptor) {
  return catchingFailures([&] {
    store_->requireReachable();
    descriptor = store_->assets().open(asset);
  });
}

NSErrorRef EmbeddedEngine::localFile(const RZAsset& asset, std::string& path) {
  return catchingFailures([&] {
    store_->assets().require(asset);
    path = store_->assets().pathFor(asset);
  });
}

NSErrorRef EmbeddedEngine::copyAsset(const RZAsset& asset, int descriptor,
                                     const RZTransfer& transfer) {
  FileDescriptor source;
  if (NSErrorRef error = openAsset(asset, source)) return error;
  const bool isLarge = asset.size > StreamHasher::kBufferBytes && isReadable(descriptor);
  const auto copy = isLarge ? rz_copyAndHashTarget : rz_copyAndHashFile;
  RZAsset copied;
  if (NSErrorRef error = copy(source.get(), descriptor, transfer, copied)) return error;
  if (copied == asset) return nullptr;
  RZAsset found = copied;
  if (isLarge) {
    if (NSErrorRef error = rz_hashFile(source.get(), {}, found)) return error;
  }
  return found == asset ? writtenToMeanwhile()
                        : catchingFailures([&] { AssetFolder::requireSame(asset, found); });
}

NSErrorRef EmbeddedEngine::readAsset(const RZAsset& asset, std::uint64_t maximumSize,
                                     std::string& bytes) {
  return catchingFailures([&] {
    store_->requireReachable();
    if (asset.size > maximumSize) {
      throwFailure(RZErrorLimitExceeded, asset.description() + " is too large for the memory");
    }
    const FileDescriptor source = store_->assets().open(asset);
    std::string content(static_cast<std::size_t>(asset.size), '\0');
    const auto span = std::as_writable_bytes(std::span(content));
    Sha256 hash;
    hash.update(span.first(readFully(source.get(), span, 0)));
    AssetFolder::requireSame(asset, hash.finish());
    bytes = std::move(content);
  });
}

NSErrorRef EmbeddedEngine::verifyAsset(const RZAsset& asset, const RZTransfer& transfer) {
  FileDescriptor source;
  if (NSErrorRef error = openAsset(asset, source)) return error;
  RZAsset found;
  if (NSErrorRef error = rz_hashFile(source.get(), transfer, found)) return error;
  return catchingFailures([&] { AssetFolder::requireSame(asset, found); });
}

NSErrorRef EmbeddedEngine::collectGarbage(RZGarbageReport& report) {
  return store_->withConnection([&](RecordsConnection& connection) {
    RZGarbageReport collected;
    removeDeadSessions(store_->assets());
    clearDeadZones(connection, store_->now(), collected);
    const auto grace = store_->options().assetGraceSeconds * 1'000'000'000;
    const auto session = store_->session();
    dropUnusedAssets(connection, store_->assets(), session->path(),
                     NSDate::fromNanoseconds(store_->now().nanoseconds() - grace), collected);
    report = collected;
  });
}

}  // namespace yomber
