#include "platform/rozzel/share.h"

#include <algorithm>
#include <array>
#include <utility>

namespace yomber {

namespace {

constexpr const char* kRootKey = "rozzel.root";
constexpr const char* kOwnerKey = "rozzel.owner";
constexpr const char* kParticipantsKey = "rozzel.participants";
constexpr const char* kPublicPermissionKey = "rozzel.public-permission";
constexpr const char* kURLKey = "rozzel.url";

/// A participant is kept as a text: one digit each for role, permission and acceptance, a space,
/// the name.
constexpr std::size_t kNameOffset = 4;

/// '?' for a number that no enumerator has: it may come from a peer.
template <typename Enumeration>
char digitFor(Enumeration value) {
  const std::int64_t number = std::to_underlying(value);
  return number >= 0 && number <= 9 ? static_cast<char>('0' + number) : '?';
}

template <typename Enumeration, std::size_t Count>
bool readDigit(char digit, const std::array<Enumeration, Count>& known, Enumeration& value) {
  const auto found = std::find_if(known.begin(), known.end(), [&](Enumeration candidate) {
    return digitFor(candidate) == digit;
  });
  if (found == known.end()) return false;
  value = *found;
  return true;
}

constexpr std::array kRoles = {RZShareParticipantRole::Owner, RZShareParticipantRole::PrivateUser,
                               RZShareParticipantRole::PublicUser};
constexpr std::array kPermissions = {RZShareParticipantPermission::None,
                                     RZShareParticipantPermission::ReadOnly,
                                     RZShareParticipantPermission::ReadWrite};
constexpr std::array kStatuses = {RZShareParticipantAcceptanceStatus::Pending,
                                  RZShareParticipantAcceptanceStatus::Accepted,
                                  RZShareParticipantAcceptanceStatus::Removed};

std::string encodeParticipant(const RZShareParticipant& participant) {
  const std::string digits{digitFor(participant.role), digitFor(participant.permission),
                           digitFor(participant.acceptanceStatus)};
  return digits + " " + participant.userName;
}

std::optional<RZShareParticipant> decodeParticipant(const std::string& text) {
  RZShareParticipant participant;
  const bool good = text.size() > kNameOffset && text[kNameOffset - 1] == ' ' &&
                    readDigit(text[0], kRoles, participant.role) &&
                    readDigit(text[1], kPermissions, participant.permission) &&
                    readDigit(text[2], kStatuses, participant.acceptanceStatus);
  if (!good) return std::nullopt;
  participant.userName = text.substr(kNameOffset);
  return participant;
}

template <typename Value>
Value valueOr(const RZRecord& record, const char* key, Value otherwise) {
  const auto* const value = record.valueForKey<Value>(key);
  return value != nullptr ? *value : otherwise;
}

bool isPermission(std::int64_t number) {
  return std::any_of(kPermissions.begin(), kPermissions.end(),
                     [&](auto permission) { return std::to_underlying(permission) == number; });
}

bool haveGoodParticipants(const RZRecord& record) {
  const auto* const texts = record.valueForKey<std::vector<std::string>>(kParticipantsKey);
  if (texts == nullptr || texts->empty()) return false;
  const auto owner = decodeParticipant(texts->front());
  return owner && owner->role == RZShareParticipantRole::Owner &&
         owner->userName == valueOr<std::string>(record, kOwnerKey, {}) &&
         std::all_of(texts->begin(), texts->end(),
                     [](const std::string& text) { return decodeParticipant(text).has_value(); });
}

bool isShare(const RZRecord& record) {
  const auto type = valueOr<std::string>(record, RZShareTypeKey, {});
  return record.recordType() == RZShareRecordType &&
         record.recordID().recordName() == RZShareRecordName &&
         (type == RZShareTypeDocument || type == RZShareTypeFolder) &&
         !valueOr<std::string>(record, kRootKey, {}).empty() &&
         !valueOr<std::string>(record, kOwnerKey, {}).empty() &&
         record.valueForKey<std::string>(RZShareTitleKey) != nullptr &&
         isPermission(valueOr<std::int64_t>(record, kPublicPermissionKey, 0)) &&
         haveGoodParticipants(record);
}

}  // namespace

std::string RZShareParticipant::description() const {
  return userName + " (role " + digitFor(role) + ", permission " + digitFor(permission) +
         ", status " + digitFor(acceptanceStatus) + ")";
}

RZShare::RZShare(const RZRecordID& rootRecordID, const std::string& type, const std::string& title,
                 const std::string& ownerName)
    : RZRecord(RZShareRecordType, RZRecordID(RZShareRecordName, rootRecordID.zoneID())) {
  setObject(rootRecordID.recordName(), kRootKey);
  setObject(type, RZShareTypeKey);
  setTitle(title);
  setOwnerName(ownerName);
  setPublicPermission(RZShareParticipantPermission::None);
  setParticipants({{.userName = ownerName,
                    .role = RZShareParticipantRole::Owner,
                    .permission = RZShareParticipantPermission::ReadWrite,
                    .acceptanceStatus = RZShareParticipantAcceptanceStatus::Accepted}});
}

RZShareRef RZShare::fromRecord(const RZRecord& record) {
  // Its constructor is private, so std::make_shared cannot.
  return isShare(record) ? RZShareRef(new RZShare(record)) : nullptr;
}

RZShareRef RZShare::fromFields(const Fields& fields) {
  const RZRecordID recordID(RZShareRecordName, fields.zoneID);
  RZShare share(RZRecord(RZShareRecordType, recordID, {}, {.changeTag = fields.changeTag}));
  share.setObject(fields.rootRecordName, kRootKey);
  share.setObject(fields.type, RZShareTypeKey);
  share.setTitle(fields.title);
  share.setOwnerName(fields.ownerName);
  share.setPublicPermission(fields.publicPermission);
  share.setParticipants(fields.participants);
  if (fields.URL) share.setURL(*fields.URL);
  return fromRecord(share);
}

RZRecordID RZShare::rootRecordID() const {
  return {valueOr<std::string>(*this, kRootKey, {}), recordID().zoneID()};
}

std::string RZShare::ownerName() const { return valueOr<std::string>(*this, kOwnerKey, {}); }

void RZShare::setOwnerName(const std::string& ownerName) { setObject(ownerName, kOwnerKey); }

std::string RZShare::type() const { return valueOr<std::string>(*this, RZShareTypeKey, {}); }

std::string RZShare::title() const { return valueOr<std::string>(*this, RZShareTitleKey, {}); }

void RZShare::setTitle(const std::string& title) { setObject(title, RZShareTitleKey); }

std::vector<RZShareParticipant> RZShare::participants() const {
  std::vector<RZShareParticipant> participants;
  for (const auto& text : valueOr<std::vector<std::string>>(*this, kParticipantsKey, {})) {
    if (auto participant = decodeParticipant(text)) participants.push_back(*std::move(participant));
  }
  return participants;
}

void RZShare::setParticipants(const std::vector<RZShareParticipant>& participants) {
  std::vector<std::string> texts;
  texts.reserve(participants.size());
  for (const auto& participant : participants) texts.push_back(encodeParticipant(participant));
  setObject(std::move(texts), kParticipantsKey);
}

RZShareParticipantPermission RZShare::publicPermission() const {
  const auto number = valueOr<std::int64_t>(*this, kPublicPermissionKey, 0);
  return isPermission(number) ? static_cast<RZShareParticipantPermission>(number)
                              : RZShareParticipantPermission::None;
}

void RZShare::setPublicPermission(RZShareParticipantPermission permission) {
  setObject(static_cast<std::int64_t>(permission), kPublicPermissionKey);
}

std::optional<std::string> RZShare::URL() const {
  const auto* const url = valueForKey<std::string>(kURLKey);
  return url != nullptr ? std::optional(*url) : std::nullopt;
}

void RZShare::setURL(const std::string& url) { setObject(url, kURLKey); }

std::string RZShare::description() const {
  return "share of \"" + title() + "\" (" + type() + ") by " + ownerName() + ", " +
         std::to_string(participants().size()) + " participants, tag " +
         (isKnownToServer() ? changeTag() : "(none)");
}

}  // namespace yomber
