#include "platform/rozzel/zone_rows.h"

#include <algorithm>
#include <limits>

#include "platform/rozzel/store_failure.h"

namespace yomber {

namespace {

bool isOwn(const RZDatabaseID& database, const RZRecordZoneID& zoneID) {
  return zoneID.ownerName() == RZCurrentUserDefaultName ||
         zoneID.ownerName() == database.accountName;
}

RZZonePermission permissionFromRow(std::int64_t permission) {
  return permission == 1 ? RZZonePermission::ReadWrite : RZZonePermission::ReadOnly;
}

std::optional<ZoneRow> zoneFromRow(RecordsQuery& query, RZRecordZoneID zoneID) {
  if (!query.step()) return std::nullopt;
  return ZoneRow{.id = query->integer(0),
                 .sequence = query->integer(1),
                 .forgotten = query->integer(2),
                 .tombstones = query->integer(3),
                 .charge = query->integer(4),
                 .owner = std::string(query->bytes(5)),
                 .zoneID = std::move(zoneID),
                 .permission = permissionFromRow(query->integer(6))};
}

std::vector<RZRecordZone> zonesFromRows(RecordsQuery query) {
  std::vector<RZRecordZone> zones;
  while (query.step()) {
    const std::string owner(query->bytes(3));
    zones.push_back({.zoneID = RZRecordZoneID(std::string(query->bytes(2)), owner),
                     .changeTag = changeTagFor(query->integer(0), query->integer(1)),
                     .permission = permissionFromRow(query->integer(4))});
  }
  return zones;
}

}  // namespace

void checkName(const std::string& name, const char* what) {
  if (name.empty()) {
    throwFailure(RZErrorInvalidArguments, std::string(what) + " must not be empty");
  }
  if (name.size() > RZMaximumNameBytes) {
    throwFailure(RZErrorLimitExceeded, std::string(what) + " must have at most " +
                                           std::to_string(RZMaximumNameBytes) + " bytes");
  }
}

void checkDatabase(const RZDatabaseID& database) {
  checkName(database.containerIdentifier, "the name of a container");
  checkName(database.accountName, "the name of an account");
  if (database.accountName == RZCurrentUserDefaultName) {
    throwFailure(RZErrorInvalidArguments, "an account needs a name of its own");
  }
}

RZRecordZoneID checkedZoneID(const RZDatabaseID& database, const RZRecordZoneID& zoneID) {
  checkDatabase(database);
  checkName(zoneID.zoneName(), "the name of a zone");
  checkName(zoneID.ownerName(), "the owner of a zone");
  const bool own = isOwn(database, zoneID);
  if (own != (database.scope == RZDatabaseScope::Private)) {
    throwFailure(RZErrorInvalidArguments, "zone " + zoneID.description() + " is in the " +
                                              (own ? "private" : "shared") +
                                              " database; ask that one");
  }
  return own ? RZRecordZoneID(zoneID.zoneName()) : zoneID;
}

std::optional<ZoneRow> findZone(RecordsConnection& connection, const RZDatabaseID& database,
                                const RZRecordZoneID& zoneID) {
  RZRecordZoneID checked = checkedZoneID(database, zoneID);
  if (database.scope == RZDatabaseScope::Private) {
    RecordsQuery query(
        connection.prepared("SELECT id, sequence, forgotten, tombstones, charge, owner, 1 "
                            "FROM zone WHERE container=?1 AND owner=?2 AND name=?3 AND dead=0"),
        database.containerIdentifier, database.accountName, zoneID.zoneName());
    return zoneFromRow(query, std::move(checked));
  }
  RecordsQuery query(
      connection.prepared("SELECT id, sequence, forgotten, tombstones, charge, owner, permission "
                          "FROM zone JOIN member ON member.zone=zone.id AND member.account=?4 "
                          "WHERE container=?1 AND owner=?2 AND name=?3 AND dead=0"),
      database.containerIdentifier, zoneID.ownerName(), zoneID.zoneName(), database.accountName);
  return zoneFromRow(query, std::move(checked));
}

ZoneRow requireZone(RecordsConnection& connection, const RZDatabaseID& database,
                    const RZRecordZoneID& zoneID) {
  auto zone = findZone(connection, database, zoneID);
  if (!zone) {
    throwFailure(RZErrorZoneNotFound, "there is no zone " + zoneID.description() + " here");
  }
  return *std::move(zone);
}

std::vector<RZRecordZone> listZones(RecordsConnection& connection, const RZDatabaseID& database) {
  checkDatabase(database);
  if (database.scope == RZDatabaseScope::Private) {
    auto zones = zonesFromRows(RecordsQuery(
        connection.prepared("SELECT id, sequence, name, owner, 1 FROM zone "
                            "WHERE container=?1 AND owner=?2 AND dead=0 ORDER BY name"),
        database.containerIdentifier, database.accountName));
    for (auto& zone : zones) zone.zoneID = RZRecordZoneID(zone.zoneID.zoneName());
    return zones;
  }
  return zonesFromRows(RecordsQuery(
      connection.prepared("SELECT id, sequence, name, owner, permission FROM member "
                          "JOIN zone ON zone.id=member.zone "
                          "WHERE account=?2 AND container=?1 AND dead=0 ORDER BY name, owner"),
      database.containerIdentifier, database.accountName));
}

void insertZone(RecordsConnection& connection, const RZDatabaseID& database,
                const RZRecordZoneID& zoneID) {
  RecordsQuery(connection.prepared("INSERT INTO zone(container, owner, name, sequence, forgotten, "
                                   "tombstones, charge, dead) VALUES(?1, ?2, ?3, 0, 0, 0, 0, 0)"),
               database.containerIdentifier, database.accountName, zoneID.zoneName())
      .run();
}

void killZone(RecordsConnection& connection, const ZoneRow& zone) {
  RecordsQuery(connection.prepared("UPDATE zone SET dead=1 WHERE id=?1"), zone.id).run();
  deleteMembers(connection, zone);
  RecordsQuery(connection.prepared("DELETE FROM share WHERE zone=?1"), zone.id).run();
}

void updateZone(RecordsConnection& connection, const ZoneRow& zone) {
  RecordsQuery(connection.prepared("UPDATE zone SET sequence=?2, forgotten=?3, tombstones=?4, "
                                   "charge=?5 WHERE id=?1"),
               zone.id, zone.sequence, zone.forgotten, zone.tombstones, zone.charge)
      .run();
}

void insertMember(RecordsConnection& connection, const ZoneRow& zone, const RZZoneMember& member) {
  checkName(member.accountName, "the name of an account");
  if (member.accountName == zone.owner || member.accountName == RZCurrentUserDefaultName) {
    throwFailure(RZErrorInvalidArguments, "a zone's owner is no member of it");
  }
  const std::int64_t permission = member.permission == RZZonePermission::ReadWrite ? 1 : 0;
  RecordsQuery(connection.prepared("INSERT OR REPLACE INTO member(zone, account, permission) "
                                   "VALUES(?1, ?2, ?3)"),
               zone.id, member.accountName, permission)
      .run();
}

void deleteMember(RecordsConnection& connection, const ZoneRow& zone,
                  const std::string& accountName) {
  RecordsQuery(connection.prepared("DELETE FROM member WHERE zone=?1 AND account=?2"), zone.id,
               accountName)
      .run();
}

void deleteMembers(RecordsConnection& connection, const ZoneRow& zone) {
  RecordsQuery(connection.prepared("DELETE FROM member WHERE zone=?1"), zone.id).run();
}

std::vector<RZZoneMember> listMembers(RecordsConnection& connection, const ZoneRow& zone) {
  std::vector<RZZoneMember> members;
  RecordsQuery query(connection.prepared("SELECT account, permission FROM member WHERE zone=?1 "
                                         "ORDER BY account"),
                     zone.id);
  while (query.step()) {
    members.push_back({.accountName = std::string(query->bytes(0)),
                       .permission = permissionFromRow(query->integer(1))});
  }
  return members;
}

std::int64_t chargeOfOwner(RecordsConnection& connection, const std::string& owner) {
  RecordsQuery query(connection.prepared("SELECT sum(charge) FROM zone WHERE owner=?1 AND dead=0"),
                     owner);
  return query.step() ? query->integer(0) : 0;
}

std::optional<std::uint64_t> quotaOfOwner(RecordsConnection& connection, const std::string& owner) {
  RecordsQuery query(connection.prepared("SELECT quota FROM account WHERE name=?1"), owner);
  if (!query.step() || query->isNull(0)) return std::nullopt;
  return static_cast<std::uint64_t>(query->integer(0));
}

void storeQuota(RecordsConnection& connection, const std::string& owner,
                std::optional<std::uint64_t> limit) {
  constexpr auto kHighest = static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max());
  RecordsQuery query(connection.prepared("INSERT OR REPLACE INTO account(name, quota) "
                                         "VALUES(?1, ?2)"),
                     owner);
  if (limit) {
    query->bindInteger(2, static_cast<std::int64_t>(std::min(*limit, kHighest)));
  } else {
    query->bindNull(2);
  }
  query.run();
}

std::string changeTagFor(std::int64_t zone, std::int64_t sequence) {
  constexpr std::string_view kDigits = "0123456789abcdef";
  const auto hexadecimal = [&](std::int64_t number) {
    std::string text;
    for (auto rest = static_cast<std::uint64_t>(number); rest > 0; rest >>= 4U) {
      text.insert(text.begin(), kDigits[rest & 15U]);
    }
    return text;
  };
  return hexadecimal(zone) + "." + hexadecimal(sequence);
}

}  // namespace yomber
