#include "platform/rozzel/share_rows.h"

#include <sys/random.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <optional>
#include <set>
#include <span>
#include <string_view>
#include <utility>

#include "platform/foundation/hexadecimal.h"
#include "platform/rozzel/record_rows.h"
#include "platform/rozzel/store_failure.h"

namespace yomber {

namespace {

using Permission = RZShareParticipantPermission;
using Role = RZShareParticipantRole;
using Status = RZShareParticipantAcceptanceStatus;

constexpr std::string_view kURLPrefix = "yomber-share:";
constexpr std::size_t kMaximumTitleBytes = 1024;

std::string newToken() {
  std::array<unsigned char, 16> bytes{};
  while (getrandom(bytes.data(), bytes.size(), 0) != static_cast<ssize_t>(bytes.size())) {
    if (errno != EINTR) throwErrno("cannot make the token of a share");
  }
  return hexadecimal(std::as_bytes(std::span(bytes)));
}

[[noreturn]] void throwNoSuchShare() {
  throwFailure(RZErrorUnknownItem,
               "there is no share with that link (any more); ask its owner for the present one");
}

void requireOwnerFirst(const std::vector<RZShareParticipant>& participants,
                       const std::string& owner) {
  const bool good = !participants.empty() && participants.front().userName == owner &&
                    participants.front().role == Role::Owner &&
                    participants.front().permission == Permission::ReadWrite &&
                    participants.front().acceptanceStatus == Status::Accepted;
  if (good) return;
  throwFailure(RZErrorInvalidArguments,
               "the first participant of a share is its owner, " + owner +
                   ", who cannot be removed or given less; destroy the share instead");
}

void checkParticipants(const RZShare& share, const std::string& owner) {
  const auto participants = share.participants();
  if (participants.size() > RZMaximumShareParticipants) {
    throwFailure(RZErrorLimitExceeded, "a share has at most " +
                                           std::to_string(RZMaximumShareParticipants) +
                                           " participants; leave some out");
  }
  requireOwnerFirst(participants, owner);
  std::set<std::string> names;
  for (const auto& participant : participants) {
    checkName(participant.userName, "the name of a participant");
    if (participant.userName == RZCurrentUserDefaultName) {
      throwFailure(RZErrorInvalidArguments, "a participant needs a name of his own");
    }
    if (!names.insert(participant.userName).second) {
      throwFailure(RZErrorInvalidArguments,
                   participant.userName + " takes part twice; leave one of them out");
    }
    if (participant.role == Role::Owner && participant.userName != owner) {
      throwFailure(RZErrorInvalidArguments,
                   participant.userName + " cannot own a share of " + owner);
    }
  }
}

/// `owner` is the account that saves.
void checkShare(const RZShare& share, const std::string& owner) {
  checkParticipants(share, owner);
  if (!RZShare::fromRecord(share)) {
    throwFailure(RZErrorInvalidArguments, share.recordID().description() +
                                              " is no share: something that each has is missing");
  }
  checkName(share.rootRecordID().recordName(), "the name of a shared record");
  if (share.title().size() > kMaximumTitleBytes) {
    throwFailure(RZErrorLimitExceeded, "the title of a share must have at most " +
                                           std::to_string(kMaximumTitleBytes) + " bytes");
  }
  for (const auto& [key, value] : share.values()) checkName(key, "a key of a record");
}

Status settledStatus(const RZShareParticipant* known, const RZShareParticipant& wanted) {
  if (wanted.acceptanceStatus == Status::Removed) return Status::Removed;
  const bool accepted = known != nullptr && known->acceptanceStatus == Status::Accepted;
  return accepted ? Status::Accepted : Status::Pending;
}

RZShareParticipant settled(const RZShareParticipant* known, const RZShareParticipant& wanted,
                           Permission publicPermission) {
  if (wanted.role == Role::Owner) return wanted;
  // Whoever came by the link has what everybody has, unless somebody gives him something else.
  const bool isPublic = wanted.role == Role::PublicUser && known != nullptr &&
                        known->role == Role::PublicUser && known->permission == wanted.permission;
  return {.userName = wanted.userName,
          .role = isPublic ? Role::PublicUser : Role::PrivateUser,
          .permission = isPublic ? publicPermission : wanted.permission,
          .acceptanceStatus = settledStatus(known, wanted)};
}

const RZShareParticipant* participantNamed(const std::vector<RZShareParticipant>& participants,
                                           const std::string& name) {
  const auto found =
      std::find_if(participants.begin(), participants.end(),
                   [&](const auto& candidate) { return candidate.userName == name; });
  return found != participants.end() ? &*found : nullptr;
}

std::optional<RZZoneMember> memberFor(const RZShareParticipant& participant) {
  const bool sees = participant.role != Role::Owner &&
                    participant.acceptanceStatus == Status::Accepted &&
                    participant.permission != Permission::None;
  if (!sees) return std::nullopt;
  return RZZoneMember{.accountName = participant.userName,
                      .permission = participant.permission == Permission::ReadWrite
                                        ? RZZonePermission::ReadWrite
                                        : RZZonePermission::ReadOnly};
}

/// The zone's members are those of the share, and nobody else.
void makeMembersFollow(RecordsConnection& connection, const ZoneRow& zone, const RZShare& share) {
  deleteMembers(connection, zone);
  for (const auto& participant : share.participants()) {
    if (const auto member = memberFor(participant)) insertMember(connection, zone, *member);
  }
}

std::optional<std::string> tokenOfZone(RecordsConnection& connection, const ZoneRow& zone) {
  RecordsQuery query(connection.prepared("SELECT token FROM share WHERE zone=?1"), zone.id);
  if (!query.step()) return std::nullopt;
  return std::string(query->bytes(0));
}

std::string urlOfZone(RecordsConnection& connection, const ZoneRow& zone) {
  auto token = tokenOfZone(connection, zone);
  if (!token) {
    token = newToken();
    RecordsQuery(connection.prepared("INSERT INTO share(zone, token) VALUES(?1, ?2)"), zone.id,
                 *token)
        .run();
  }
  return std::string(kURLPrefix) + *token;
}

/// What `accountName` is in the share once it has accepted. Throws RZErrorPermissionFailure.
RZShareParticipant acceptedParticipant(const RZShare& share, const std::string& accountName) {
  const auto participants = share.participants();
  const auto* const known = participantNamed(participants, accountName);
  if (known != nullptr && memberFor(*known)) return *known;
  const bool isNamed = known != nullptr && known->role == Role::PrivateUser;
  if (isNamed && known->permission == Permission::None) {
    throwFailure(RZErrorPermissionFailure,
                 "the owner of the share has taken the permission from " + accountName);
  }
  if (isNamed && known->acceptanceStatus == Status::Pending) {
    RZShareParticipant accepted = *known;
    accepted.acceptanceStatus = Status::Accepted;
    return accepted;
  }
  if (share.publicPermission() == Permission::None) {
    throwFailure(RZErrorPermissionFailure, "the share is not for " + accountName + "; ask " +
                                               share.ownerName() + " to add that name");
  }
  return {.userName = accountName,
          .role = Role::PublicUser,
          .permission = share.publicPermission(),
          .acceptanceStatus = Status::Accepted};
}

/// The share with that participant as given, in the place that he had.
std::shared_ptr<RZShare> withParticipant(const RZShare& share, const RZShareParticipant& wanted) {
  auto participants = share.participants();
  const auto found =
      std::find_if(participants.begin(), participants.end(),
                   [&](const auto& candidate) { return candidate.userName == wanted.userName; });
  if (found != participants.end()) {
    *found = wanted;
  } else {
    participants.push_back(wanted);
  }
  auto changed = std::make_shared<RZShare>(share);
  changed->setParticipants(participants);
  return changed;
}

}  // namespace

RZShareRef readShare(RecordsConnection& connection, const ZoneRow& zone) {
  const auto row = findRecord(connection, zone, RZShareRecordName, std::nullopt);
  if (!row || row->record->recordType() != RZShareRecordType) {
    throwFailure(RZErrorUnknownItem, "zone " + zone.zoneID.description() + " is not shared");
  }
  RZShareRef share = RZShare::fromRecord(*row->record);
  if (!share) {
    throwFailure(RZErrorStoreDamaged, "the share of zone " + zone.zoneID.description() +
                                          " is damaged; destroy it, and share again");
  }
  return share;
}

std::vector<RZShareParticipant> settledParticipants(const std::vector<RZShareParticipant>& stored,
                                                    const RZShare& wanted) {
  std::vector<RZShareParticipant> participants;
  for (const auto& participant : wanted.participants()) {
    participants.push_back(settled(participantNamed(stored, participant.userName), participant,
                                   wanted.publicPermission()));
  }
  return participants;
}

ShareWriter::ShareWriter(const BatchWriter::Surroundings& surroundings)
    : connection_(surroundings.connection), surroundings_(surroundings) {
  surroundings_.mayDeleteShares = true;
}

RZShareRef ShareWriter::save(const RZDatabaseID& database, const RZShare& share) {
  const RZRecordZoneID zoneID = checkedZoneID(database, share.recordID().zoneID());
  checkShare(share, database.accountName);
  if (!findZone(connection_, database, zoneID)) {
    if (share.isKnownToServer()) throwFailure(RZErrorUnknownItem, "the share was destroyed");
    insertZone(connection_, database, zoneID);
  }
  const OwnZone own{.database = database, .zone = requireZone(connection_, database, zoneID)};
  const auto row = findRecordToChange(connection_, own.zone, RZShareRecordName);
  if (row && share.changeTag() != row->record->changeTag()) {
    const RZShareRef current = RZShare::fromRecord(*row->record);
    throwChanged({.record = current ? RZRecordRef(current) : row->record,
                  .isDamaged = row->isDamaged || !current});
  }
  const RZShareRef known = row ? RZShare::fromRecord(*row->record) : nullptr;
  RZShare wanted = share;
  wanted.setParticipants(settledParticipants(
      known ? known->participants() : std::vector<RZShareParticipant>(), share));
  wanted.setURL(urlOfZone(connection_, own.zone));
  return store(own, wanted);
}

void ShareWriter::destroy(const RZDatabaseID& database, const RZShare& share) {
  const auto zone = findZone(connection_, database, share.recordID().zoneID());
  if (!zone) return;
  const auto row = findRecordToChange(connection_, *zone, RZShareRecordName);
  if (!row || row->record->recordType() != RZShareRecordType) return;
  const RZShareRef current = RZShare::fromRecord(*row->record);
  // Nobody can have read a damaged one, so nobody has its tag.
  if (current && share.changeTag() != current->changeTag()) throwChanged({.record = current});
  deleteMembers(connection_, *zone);
  RecordsQuery(connection_.prepared("DELETE FROM share WHERE zone=?1"), zone->id).run();
  BatchWriter(surroundings_, database)
      .write({.recordsToDelete = {{.recordID = row->record->recordID()}}});
}

void ShareWriter::leave(const RZDatabaseID& database, const RZRecordZoneID& zoneID) {
  const auto zone = findZone(connection_, database, zoneID);
  if (!zone) return;
  deleteMember(connection_, *zone, database.accountName);
  const OwnZone own = inOwnersHands(database, *zone);
  const auto row = findRecordToChange(connection_, own.zone, RZShareRecordName);
  const RZShareRef share = row ? RZShare::fromRecord(*row->record) : nullptr;
  if (!share) return;
  const auto participants = share->participants();
  const auto* const known = participantNamed(participants, database.accountName);
  if (known == nullptr) return;
  RZShareParticipant gone = *known;
  gone.acceptanceStatus = Status::Removed;
  store(own, *withParticipant(*share, gone));
}

RZShareRef ShareWriter::accept(const std::string& containerIdentifier,
                               const std::string& accountName, const std::string& url) {
  const RZDatabaseID database{containerIdentifier, accountName, RZDatabaseScope::Shared};
  checkDatabase(database);
  const OwnZone own = zoneOfToken(containerIdentifier, url);
  RZShareRef share = readShare(connection_, own.zone);
  if (own.zone.owner == accountName) return share;
  admit(own, *share, accountName);
  const RZRecordZoneID zoneID(own.zone.zoneID.zoneName(), own.zone.owner);
  return readShare(connection_, requireZone(connection_, database, zoneID));
}

void ShareWriter::admit(const OwnZone& own, const RZShare& share, const std::string& accountName) {
  const auto participants = share.participants();
  const auto* const known = participantNamed(participants, accountName);
  const RZShareParticipant accepted = acceptedParticipant(share, accountName);
  if (known == nullptr && participants.size() >= RZMaximumShareParticipants) {
    throwFailure(RZErrorLimitExceeded, "the share has as many participants as it can have; ask " +
                                           share.ownerName() + " to remove some");
  }
  if (known != nullptr && *known == accepted) {
    insertMember(connection_, own.zone, *memberFor(accepted));
  } else {
    store(own, *withParticipant(share, accepted));
  }
}

ShareWriter::OwnZone ShareWriter::zoneOfToken(const std::string& containerIdentifier,
                                              const std::string& url) {
  if (!url.starts_with(kURLPrefix)) throwNoSuchShare();
  const std::string token = url.substr(kURLPrefix.size());
  RecordsQuery query(connection_.prepared("SELECT owner, name FROM share "
                                          "JOIN zone ON zone.id=share.zone "
                                          "WHERE token=?1 AND container=?2 AND dead=0"),
                     token, containerIdentifier);
  if (!query.step()) throwNoSuchShare();
  const RZDatabaseID database{containerIdentifier, std::string(query->bytes(0)),
                              RZDatabaseScope::Private};
  const RZRecordZoneID zoneID(std::string(query->bytes(1)));
  return {.database = database, .zone = requireZone(connection_, database, zoneID)};
}

ShareWriter::OwnZone ShareWriter::inOwnersHands(const RZDatabaseID& database, const ZoneRow& zone) {
  const RZDatabaseID owners{database.containerIdentifier, zone.owner, RZDatabaseScope::Private};
  return {.database = owners,
          .zone = requireZone(connection_, owners, RZRecordZoneID(zone.zoneID.zoneName()))};
}

/// Every key is written: what the share came from need not be what the store has.
RZShareRef ShareWriter::store(const OwnZone& own, const RZShare& share) {
  const auto record =
      std::make_shared<RZRecord>(share.recordType(), RZRecordID(RZShareRecordName, own.zone.zoneID),
                                 RZValues(), RZRecord::Stamp{.changeTag = share.changeTag()});
  for (const auto& [key, value] : share.values()) record->setObject(value, key);
  const auto saved = BatchWriter(surroundings_, own.database).write({.recordsToSave = {record}});
  RZShareRef stored = RZShare::fromRecord(*saved.front());
  makeMembersFollow(connection_, own.zone, *stored);
  return stored;
}

}  // namespace yomber
