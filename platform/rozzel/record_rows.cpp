#include "platform/rozzel/record_rows.h"

#include <algorithm>
#include <map>
#include <utility>

#include "platform/rozzel/change_tokens.h"
#include "platform/rozzel/record_codec.h"
#include "platform/rozzel/store_failure.h"

namespace yomber {

namespace {

/// A page ends with the record that brings it to this, whatever its limit.
constexpr std::size_t kPageBytes = 8 << 20;

/// What every statement that reads records selects, in this order.
#define RECORD_COLUMNS "id, sequence, name, type, created, modified, charge, body"

constexpr const char* kRecordByName =
    "SELECT " RECORD_COLUMNS " FROM record WHERE zone=?1 AND name=?2";

RecordRow recordFromRow(RecordsQuery& query, const ZoneRow& zone, RZValues values) {
  const std::int64_t sequence = query->integer(1);
  RZRecord::Stamp stamp{.changeTag = changeTagFor(zone.id, sequence),
                        .creationDate = NSDate::fromNanoseconds(query->integer(4)),
                        .modificationDate = NSDate::fromNanoseconds(query->integer(5))};
  return {.id = query->integer(0),
          .sequence = sequence,
          .charge = query->integer(6),
          .record = std::make_shared<RZRecord>(
              std::string(query->bytes(3)), RZRecordID(std::string(query->bytes(2)), zone.zoneID),
              std::move(values), std::move(stamp))};
}

RecordRow recordFromRow(RecordsQuery& query, const ZoneRow& zone,
                        const RZDesiredKeys& desiredKeys) {
  return recordFromRow(query, zone, decodeRecordValues(query->bytes(7), desiredKeys));
}

std::size_t bodyBytes(RecordsQuery& query) { return query->bytes(7).size(); }

std::size_t pageLimit(std::size_t limit) {
  return std::clamp<std::size_t>(limit, 1, RZMaximumPageRecords);
}

/// The zones that a fetch asks for, each looked up once.
class ZoneLookup {
 public:
  ZoneLookup(RecordsConnection& connection, const RZDatabaseID& database)
      : connection_(connection), database_(database) {}

  const std::optional<ZoneRow>& find(const RZRecordZoneID& zoneID) {
    const auto found = zones_.find(zoneID);
    if (found != zones_.end()) return found->second;
    return zones_.emplace(zoneID, findZone(connection_, database_, zoneID)).first->second;
  }

 private:
  RecordsConnection& connection_;
  const RZDatabaseID& database_;
  std::map<RZRecordZoneID, std::optional<ZoneRow>> zones_;
};

[[noreturn]] void failExpired() {
  throwFailure(RZErrorChangeTokenExpired,
               "the change token cannot be used any more; begin again without one");
}

std::int64_t storeIdentity(RecordsConnection& connection) {
  RecordsQuery query(connection.prepared("SELECT value FROM meta WHERE key='identity'"));
  return query.step() ? query->integer(0) : 0;
}

/// The reader's position, if its token is one of this zone and nothing was forgotten since.
ChangePosition positionFor(RecordsConnection& connection, const ZoneRow& zone,
                           const RZChangeToken& token) {
  const std::int64_t store = storeIdentity(connection);
  if (token.empty()) {
    return {.store = store, .zone = zone.id, .sequence = 0, .beginning = zone.sequence};
  }
  const auto position = decodeChangeToken(token);
  if (!position || position->store != store || position->zone != zone.id) failExpired();
  if (position->sequence > zone.sequence || position->beginning > zone.sequence) failExpired();
  if (zone.forgotten > std::max(position->sequence, position->beginning)) failExpired();
  return *position;
}

/// Goes through the records and the deletions of a zone together, in the order of their changes.
class ChangeReader {
 public:
  ChangeReader(RecordsConnection& connection, const ZoneRow& zone, const ChangePosition& position)
      : zone_(zone),
        records_(connection.prepared("SELECT " RECORD_COLUMNS " FROM record "
                                     "WHERE zone=?1 AND sequence>?2 ORDER BY sequence"),
                 zone.id, position.sequence),
        deletions_(connection.prepared("SELECT sequence, name, type FROM tombstone "
                                       "WHERE zone=?1 AND sequence>?2 ORDER BY sequence"),
                   zone.id, std::max(position.sequence, position.beginning)),
        record_(records_.step()),
        deletion_(deletions_.step()) {}

  [[nodiscard]] bool atEnd() const { return !record_ && !deletion_; }

  /// Takes the next change and answers its sequence.
  std::int64_t take(const RZDesiredKeys& desiredKeys, RZRecordChange& change, std::size_t& bytes) {
    if (record_ && (!deletion_ || records_->integer(1) < deletions_->integer(0))) {
      const std::int64_t sequence = records_->integer(1);
      change = {RZRecordID(std::string(records_->bytes(2)), zone_.zoneID),
                std::string(records_->bytes(3)), nullptr, nullptr};
      change.error = catchingFailures(
          [&] { change.record = recordFromRow(records_, zone_, desiredKeys).record; });
      bytes += bodyBytes(records_);
      record_ = records_.step();
      return sequence;
    }
    const std::int64_t sequence = deletions_->integer(0);
    change = {RZRecordID(std::string(deletions_->bytes(1)), zone_.zoneID),
              std::string(deletions_->bytes(2)), nullptr, nullptr};
    deletion_ = deletions_.step();
    return sequence;
  }

 private:
  const ZoneRow& zone_;
  RecordsQuery records_;
  RecordsQuery deletions_;
  bool record_;
  bool deletion_;
};

std::string nameAfterCursor(const ZoneRow& zone, const std::string& cursor) {
  if (cursor.empty()) return {};
  auto name = decodeQueryCursor(zone.id, cursor);
  if (!name) {
    throwFailure(RZErrorInvalidArguments,
                 "the cursor is not of a query in this zone; begin again without one");
  }
  return *std::move(name);
}

RZQueryPage pageFromRows(RecordsQuery rows, const ZoneRow& zone, const RZDesiredKeys& desiredKeys,
                         std::size_t limit) {
  RZQueryPage page;
  std::size_t bytes = 0;
  while (rows.step()) {
    if (page.records.size() == limit || bytes >= kPageBytes) {
      page.cursor = encodeQueryCursor(zone.id, page.records.back()->recordID().recordName());
      break;
    }
    bytes += bodyBytes(rows);
    page.records.push_back(recordFromRow(rows, zone, desiredKeys).record);
  }
  return page;
}

}  // namespace

std::optional<RecordRow> findRecord(RecordsConnection& connection, const ZoneRow& zone,
                                    const std::string& name, const RZDesiredKeys& desiredKeys) {
  RecordsQuery query(connection.prepared(kRecordByName), zone.id, name);
  if (!query.step()) return std::nullopt;
  return recordFromRow(query, zone, desiredKeys);
}

std::optional<RecordRow> findRecordToChange(RecordsConnection& connection, const ZoneRow& zone,
                                            const std::string& name) {
  RecordsQuery query(connection.prepared(kRecordByName), zone.id, name);
  if (!query.step()) return std::nullopt;
  RZValues values;
  const NSErrorRef damage =
      catchingFailures([&] { values = decodeRecordValues(query->bytes(7), std::nullopt); });
  if (damage && !rz_isError(damage, RZErrorStoreDamaged)) throw StoreFailure{damage};
  RecordRow row = recordFromRow(query, zone, damage ? RZValues() : std::move(values));
  row.isDamaged = damage != nullptr;
  return row;
}

std::vector<RZFetchedRecord> readRecords(RecordsConnection& connection,
                                         const RZDatabaseID& database,
                                         const std::vector<RZRecordID>& recordIDs,
                                         const RZDesiredKeys& desiredKeys) {
  ZoneLookup zones(connection, database);
  std::vector<RZFetchedRecord> records;
  records.reserve(recordIDs.size());
  for (const RZRecordID& id : recordIDs) {
    RZFetchedRecord fetched{.recordID = id, .record = nullptr, .error = nullptr};
    fetched.error = catchingFailures([&] {
      const auto& zone = zones.find(id.zoneID());
      if (!zone) {
        throwFailure(RZErrorZoneNotFound, "there is no zone " + id.zoneID().description());
      }
      const auto row = findRecord(connection, *zone, id.recordName(), desiredKeys);
      if (!row) throwFailure(RZErrorUnknownItem, "there is no record " + id.description());
      fetched.record = row->record;
    });
    records.push_back(std::move(fetched));
  }
  return records;
}

RZChangePage readChanges(RecordsConnection& connection, const ZoneRow& zone,
                         const RZChangeToken& token, std::size_t limit,
                         const RZDesiredKeys& desiredKeys) {
  ChangePosition position = positionFor(connection, zone, token);
  ChangeReader reader(connection, zone, position);
  RZChangePage page;
  std::size_t bytes = 0;
  while (!reader.atEnd() && page.changes.size() < pageLimit(limit) && bytes < kPageBytes) {
    position.sequence = reader.take(desiredKeys, page.changes.emplace_back(), bytes);
  }
  page.moreComing = !reader.atEnd();
  if (!page.moreComing) position.sequence = zone.sequence;
  page.token = encodeChangeToken(position);
  return page;
}

RZQueryPage readQueryPage(RecordsConnection& connection, const ZoneRow& zone, const RZQuery& query,
                          const std::string& cursor, std::size_t limit) {
  const std::string after = nameAfterCursor(zone, cursor);
  if (query.recordType) {
    return pageFromRows(
        RecordsQuery(connection.prepared("SELECT " RECORD_COLUMNS " FROM record WHERE zone=?1 "
                                         "AND type=?3 AND name>?2 ORDER BY name"),
                     zone.id, after, *query.recordType),
        zone, query.desiredKeys, pageLimit(limit));
  }
  return pageFromRows(
      RecordsQuery(connection.prepared("SELECT " RECORD_COLUMNS " FROM record WHERE zone=?1 "
                                       "AND name>?2 ORDER BY name"),
                   zone.id, after),
      zone, query.desiredKeys, pageLimit(limit));
}

}  // namespace yomber
