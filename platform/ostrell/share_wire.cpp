#include "platform/ostrell/share_wire.h"

#include <string>
#include <utility>

#include "platform/fileprovider/item_codec.h"
#include "platform/ipc/error_codec.h"
#include "platform/ostrell/daemon_wire.h"
#include "platform/rozzel/engine.h"

namespace yomber {
namespace {

/// Titles are names of items; tags and links are short.
constexpr std::size_t kMaximumTextBytes = 4096;

bool isName(const std::string& text) { return !text.empty() && text.size() <= RZMaximumNameBytes; }

/// Numbers that are no enumerator are found by whoever makes the share.
RZShareParticipant decodeParticipant(protocol::Share::Participant::Reader reader) {
  return {.userName = stringFromWire(reader.getUserName()),
          .role = static_cast<RZShareParticipantRole>(reader.getRole()),
          .permission = static_cast<RZShareParticipantPermission>(reader.getPermission()),
          .acceptanceStatus =
              static_cast<RZShareParticipantAcceptanceStatus>(reader.getAcceptanceStatus())};
}

}  // namespace

void encodeParticipants(const std::vector<RZShareParticipant>& participants,
                        WireParticipants::Builder list) {
  for (unsigned i = 0; i < list.size(); ++i) {
    list[i].setUserName(wireText(participants[i].userName));
    list[i].setRole(std::to_underlying(participants[i].role));
    list[i].setPermission(std::to_underlying(participants[i].permission));
    list[i].setAcceptanceStatus(std::to_underlying(participants[i].acceptanceStatus));
  }
}

std::optional<std::vector<RZShareParticipant>> decodeParticipants(WireParticipants::Reader list) {
  if (list.size() > RZMaximumShareParticipants) return std::nullopt;
  std::vector<RZShareParticipant> participants;
  participants.reserve(list.size());
  for (const auto each : list) {
    participants.push_back(decodeParticipant(each));
    if (!isName(participants.back().userName)) return std::nullopt;
  }
  return participants;
}

void encodeShare(const RZShare& share, protocol::Share::Builder builder) {
  builder.setZoneName(wireText(share.recordID().zoneID().zoneName()));
  builder.setZoneOwner(wireText(share.recordID().zoneID().ownerName()));
  builder.setRootRecord(wireText(share.rootRecordID().recordName()));
  builder.setChangeTag(wireText(share.changeTag()));
  builder.setType(wireText(share.type()));
  builder.setTitle(wireText(share.title()));
  builder.setOwnerName(wireText(share.ownerName()));
  const auto participants = share.participants();
  encodeParticipants(participants,
                     builder.initParticipants(static_cast<unsigned>(participants.size())));
  builder.setPublicPermission(std::to_underlying(share.publicPermission()));
  if (const auto url = share.URL()) builder.getUrl().setValue(wireData(*url));
}

RZShareRef decodeShare(protocol::Share::Reader reader) {
  auto participants = decodeParticipants(reader.getParticipants());
  if (!participants) return nullptr;
  const RZRecordZoneID zoneID(stringFromWire(reader.getZoneName()),
                              stringFromWire(reader.getZoneOwner()));
  RZShare::Fields fields{
      .zoneID = zoneID,
      .rootRecordName = stringFromWire(reader.getRootRecord()),
      .changeTag = stringFromWire(reader.getChangeTag()),
      .type = stringFromWire(reader.getType()),
      .title = stringFromWire(reader.getTitle()),
      .ownerName = stringFromWire(reader.getOwnerName()),
      .publicPermission = static_cast<RZShareParticipantPermission>(reader.getPublicPermission())};
  if (reader.getUrl().isValue()) fields.URL = stringFromWire(reader.getUrl().getValue());
  const bool isBounded = isName(zoneID.zoneName()) && isName(zoneID.ownerName()) &&
                         isName(fields.rootRecordName) && isName(fields.ownerName) &&
                         fields.changeTag.size() <= kMaximumTextBytes &&
                         fields.title.size() <= kMaximumTextBytes &&
                         fields.URL.value_or("").size() <= kMaximumTextBytes;
  if (!isBounded) return nullptr;
  fields.participants = std::move(*participants);
  return RZShare::fromFields(fields);
}

RZShareRef decodeShareResult(protocol::ShareResult::Reader reader, NSErrorRef* error) {
  if (reader.isError()) {
    storeError(error, ipc::decodeError(reader.getError()));
    return nullptr;
  }
  auto share = reader.isShare() ? decodeShare(reader.getShare()) : nullptr;
  if (!share) storeError(error, unintelligibleReply("a share"));
  return share;
}

}  // namespace yomber
