#include "platform/rozzel/record_batch.h"

#include <algorithm>
#include <string_view>
#include <utility>

#include "platform/rozzel/record_codec.h"
#include "platform/rozzel/store_failure.h"

namespace yomber {

namespace {

std::string_view hashBytes(const RZAsset& asset) {
  // NOLINTNEXTLINE: a hash is bytes to SQLite.
  return {reinterpret_cast<const char*>(asset.hash.data()), asset.hash.size()};
}

void checkRecordID(const RZDatabaseID& database, const RZRecordID& id, std::set<RZRecordID>& seen) {
  const RZRecordZoneID zoneID = checkedZoneID(database, id.zoneID());
  checkName(id.recordName(), "the name of a record");
  if (!seen.emplace(id.recordName(), zoneID).second) {
    throwFailure(RZErrorInvalidArguments,
                 id.description() + " is twice in the batch; leave one of them out");
  }
}

[[noreturn]] void refuseShare(const RZRecordID& id) {
  throwFailure(RZErrorInvalidArguments,
               id.description() + " is a share; save it, or destroy it, as one");
}

void checkRecord(const RZRecord& record) {
  checkName(record.recordType(), "the type of a record");
  if (record.recordType() == RZShareRecordType) refuseShare(record.recordID());
  for (const auto& [key, value] : record.values()) checkName(key, "a key of a record");
}

std::int64_t chargeFor(const RZRecord& record, std::size_t bodyBytes) {
  std::uint64_t charge =
      bodyBytes + record.recordID().recordName().size() + record.recordType().size();
  for (const RZAsset& asset : record.assets()) charge += asset.size;
  return static_cast<std::int64_t>(charge);
}

std::string encodeChecked(const RZRecord& record) {
  std::string body = encodeRecordValues(record.values());
  if (body.size() > RZMaximumRecordBytes) {
    throwFailure(RZErrorLimitExceeded, record.recordID().description() + " would have " +
                                           std::to_string(body.size()) + " bytes, the most is " +
                                           std::to_string(RZMaximumRecordBytes) +
                                           "; put large values into assets");
  }
  return body;
}

/// The values after a save over `current`.
RZValues mergedValues(const RZRecord& current, const RZRecord& record, RZRecordSavePolicy policy) {
  RZValues values = current.values();
  for (const std::string& key : record.changedKeys()) {
    if (record.objectForKey(key) == nullptr) values.erase(key);
  }
  for (const auto& [key, value] : record.values()) {
    if (policy == RZRecordSavePolicy::AllKeys || record.changedKeys().contains(key)) {
      values.insert_or_assign(key, value);
    }
  }
  return values;
}

}  // namespace

void checkBatch(const RZDatabaseID& database, const RZRecordBatch& batch) {
  checkDatabase(database);
  if (batch.recordsToSave.size() + batch.recordsToDelete.size() > RZMaximumBatchRecords) {
    throwFailure(
        RZErrorLimitExceeded,
        "a batch has at most " + std::to_string(RZMaximumBatchRecords) + " records; split it");
  }
  std::set<RZRecordID> seen;
  for (const RZRecordRef& record : batch.recordsToSave) {
    if (!record) throwFailure(RZErrorInvalidArguments, "a record to save is nil");
    checkRecordID(database, record->recordID(), seen);
    checkRecord(*record);
  }
  for (const RZRecordDeletion& deletion : batch.recordsToDelete) {
    checkRecordID(database, deletion.recordID, seen);
  }
}

BatchWriter::BatchWriter(const Surroundings& surroundings, const RZDatabaseID& database)
    : connection_(surroundings.connection),
      assets_(surroundings.assets),
      now_(surroundings.now),
      maximumTombstones_(surroundings.maximumTombstones),
      mayDeleteShares_(surroundings.mayDeleteShares),
      database_(database) {}

std::vector<RZRecordRef> BatchWriter::write(const RZRecordBatch& batch) {
  RZFailedRecords failures;
  std::vector<RZRecordRef> saved;
  // Goes on after a refusal, so that all of them are told; the transaction is rolled back anyway.
  // What is no refusal of a record (a full disk) ends it at once.
  const auto attempt = [&](const RZRecordID& id, const auto& work) {
    try {
      work();
    } catch (const StoreFailure& failure) {
      if (rz_isTransient(failure.error) || rz_isError(failure.error, RZErrorStoreFailure)) throw;
      failures.emplace_back(id, failure.error);
    }
  };
  for (const RZRecordRef& record : batch.recordsToSave) {
    attempt(record->recordID(), [&] { saved.push_back(save(*record, batch.savePolicy)); });
  }
  for (const RZRecordDeletion& deletion : batch.recordsToDelete) {
    attempt(deletion.recordID, [&] { remove(deletion); });
  }
  if (NSErrorRef error = rz_batchError(std::move(failures))) throw StoreFailure{std::move(error)};
  for (auto& [zoneID, zone] : zones_) {
    forgetOldDeletions(zone);
    updateZone(connection_, zone);
  }
  checkQuotas();
  return saved;
}

ZoneRow& BatchWriter::writableZone(const RZRecordZoneID& zoneID) {
  const RZRecordZoneID checked = checkedZoneID(database_, zoneID);
  auto found = zones_.find(checked);
  if (found == zones_.end()) {
    found = zones_.emplace(checked, requireZone(connection_, database_, checked)).first;
    const std::string& owner = found->second.owner;
    chargesBefore_.try_emplace(owner, chargeOfOwner(connection_, owner));
  }
  if (found->second.permission != RZZonePermission::ReadWrite) {
    throwFailure(RZErrorPermissionFailure,
                 "zone " + checked.description() + " is shared for reading only");
  }
  return found->second;
}

RZRecordRef BatchWriter::save(const RZRecord& record, RZRecordSavePolicy policy) {
  ZoneRow& zone = writableZone(record.recordID().zoneID());
  const auto row = findRecordToChange(connection_, zone, record.recordID().recordName());
  const bool guarded = policy == RZRecordSavePolicy::IfServerRecordUnchanged;
  if (!row) {
    if (guarded && !record.changeTag().empty()) {
      throwFailure(RZErrorUnknownItem, record.recordID().description() + " was deleted");
    }
    return insert(zone, record);
  }
  if (guarded && record.changeTag() != row->record->changeTag()) throwChanged(*row);
  return update(zone, *row, record, policy);
}

RZRecordRef BatchWriter::insert(ZoneRow& zone, const RZRecord& record) {
  const std::string body = encodeChecked(record);
  const std::int64_t charge = chargeFor(record, body.size());
  const std::string& name = record.recordID().recordName();
  useAssets(record.assets(), {});
  removeTombstone(zone, name);
  ++zone.sequence;
  zone.charge += charge;
  RecordsQuery(connection_.prepared("INSERT INTO record(zone, name, type, sequence, created, "
                                    "modified, charge, body) "
                                    "VALUES(?1, ?2, ?3, ?4, ?5, ?5, ?6, ?7)"),
               zone.id, name, record.recordType(), zone.sequence, now_.nanoseconds(), charge, body)
      .run();
  return std::make_shared<RZRecord>(
      record.recordType(), RZRecordID(name, zone.zoneID), record.values(),
      RZRecord::Stamp{changeTagFor(zone.id, zone.sequence), now_, now_});
}

RZRecordRef BatchWriter::update(ZoneRow& zone, const RecordRow& row, const RZRecord& record,
                                RZRecordSavePolicy policy) {
  if (record.recordType() != row.record->recordType()) {
    throwFailure(RZErrorInvalidArguments, record.recordID().description() + " is a " +
                                              row.record->recordType() + ", not a " +
                                              record.recordType());
  }
  const auto merged = std::make_shared<RZRecord>(
      row.record->recordType(), row.record->recordID(), mergedValues(*row.record, record, policy),
      RZRecord::Stamp{changeTagFor(zone.id, zone.sequence + 1), row.record->creationDate(), now_});
  const std::string body = encodeChecked(*merged);
  const std::int64_t charge = chargeFor(*merged, body.size());
  useAssets(merged->assets(), row.record->assets());
  ++zone.sequence;
  zone.charge += charge - row.charge;
  RecordsQuery(connection_.prepared("UPDATE record SET sequence=?2, modified=?3, charge=?4, "
                                    "body=?5 WHERE id=?1"),
               row.id, zone.sequence, now_.nanoseconds(), charge, body)
      .run();
  return merged;
}

void BatchWriter::remove(const RZRecordDeletion& deletion) {
  ZoneRow& zone = writableZone(deletion.recordID.zoneID());
  const auto row = findRecordToChange(connection_, zone, deletion.recordID.recordName());
  if (!row) return;
  if (row->record->recordType() == RZShareRecordType && !mayDeleteShares_) {
    refuseShare(deletion.recordID);
  }
  if (!deletion.changeTag.empty() && deletion.changeTag != row->record->changeTag()) {
    throwChanged(*row);
  }
  useAssets({}, row->record->assets());
  zone.charge -= row->charge;
  RecordsQuery(connection_.prepared("DELETE FROM record WHERE id=?1"), row->id).run();
  addTombstone(zone, *row->record);
}

void BatchWriter::addTombstone(ZoneRow& zone, const RZRecord& record) {
  ++zone.sequence;
  ++zone.tombstones;
  RecordsQuery(connection_.prepared("INSERT INTO tombstone(zone, sequence, name, type) "
                                    "VALUES(?1, ?2, ?3, ?4)"),
               zone.id, zone.sequence, record.recordID().recordName(), record.recordType())
      .run();
}

void BatchWriter::removeTombstone(ZoneRow& zone, const std::string& name) {
  RecordsQuery(connection_.prepared("DELETE FROM tombstone WHERE zone=?1 AND name=?2"), zone.id,
               name)
      .run();
  zone.tombstones -= connection_.changes();
}

/// Leaves a tenth of room, so that not every deletion has to forget another one.
void BatchWriter::forgetOldDeletions(ZoneRow& zone) {
  const auto maximum = static_cast<std::int64_t>(maximumTombstones_);
  if (zone.tombstones <= maximum + maximum / 10) return;
  const std::int64_t excess = zone.tombstones - maximum;
  RecordsQuery last(connection_.prepared("SELECT sequence FROM tombstone WHERE zone=?1 "
                                         "ORDER BY sequence LIMIT 1 OFFSET ?2"),
                    zone.id, excess - 1);
  if (!last.step()) return;
  zone.forgotten = last->integer(0);
  RecordsQuery(connection_.prepared("DELETE FROM tombstone WHERE zone=?1 AND sequence<=?2"),
               zone.id, zone.forgotten)
      .run();
  zone.tombstones -= connection_.changes();
}

/// The content of an asset that is newly referred to must be there; what the record referred to
/// before is not looked at again, so that a damaged store hinders no renaming.
void BatchWriter::useAssets(const std::vector<RZAsset>& added,
                            const std::vector<RZAsset>& released) {
  for (const RZAsset& asset : added) {
    if (std::find(released.begin(), released.end(), asset) == released.end()) {
      assets_.require(asset);
    }
    RecordsQuery(connection_.prepared("INSERT INTO asset(hash, size, uses, released) "
                                      "VALUES(?1, ?2, 1, 0) "
                                      "ON CONFLICT(hash) DO UPDATE SET uses=uses+1"),
                 hashBytes(asset), static_cast<std::int64_t>(asset.size))
        .run();
  }
  for (const RZAsset& asset : released) releaseAsset(connection_, asset, now_);
}

void BatchWriter::checkQuotas() {
  for (const auto& [owner, before] : chargesBefore_) {
    const auto limit = quotaOfOwner(connection_, owner);
    if (!limit) continue;
    const std::int64_t after = chargeOfOwner(connection_, owner);
    if (after > before && static_cast<std::uint64_t>(after) > *limit) {
      throwFailure(RZErrorQuotaExceeded, "the save needs " + std::to_string(after) +
                                             " bytes of a quota of " + std::to_string(*limit) +
                                             "; delete something, or raise the quota");
    }
  }
}

void throwChanged(const RecordRow& row) {
  const RZRecordRef& server = row.record;
  if (row.isDamaged) {
    // What it was changed to cannot be shown.
    throwFailure(
        RZErrorServerRecordChanged,
        server->recordID().description() +
            " was changed by another, and is damaged; save it with all keys, or delete it");
  }
  throw StoreFailure{rz_error(RZErrorServerRecordChanged,
                              server->recordID().description() + " was changed by another",
                              {{RZErrorServerRecordKey, NSObjectRef(server)}})};
}

void releaseAsset(RecordsConnection& connection, const RZAsset& asset, NSDate now) {
  RecordsQuery(connection.prepared("UPDATE asset SET uses=max(uses-1, 0), released=?2 "
                                   "WHERE hash=?1"),
               hashBytes(asset), now.nanoseconds())
      .run();
}

}  // namespace yomber
