#include "yomber/share_output.h"

#include <algorithm>
#include <vector>

#include <nlohmann/json.hpp>

#include "yomber/item_output.h"

namespace yomber {

namespace {

const char* statusWord(const RZShareParticipant& participant) {
  switch (participant.acceptanceStatus) {
    case RZShareParticipantAcceptanceStatus::Accepted:
      return "accepted";
    case RZShareParticipantAcceptanceStatus::Removed:
      return "removed";
    case RZShareParticipantAcceptanceStatus::Pending:
      break;
  }
  return "pending";
}

const char* roleOf(const RZShareParticipant& participant) {
  if (participant.role == RZShareParticipantRole::Owner) return "owner";
  return roleWord(participant.permission);
}

std::string padded(std::string text, std::size_t width) {
  if (text.size() < width) text.append(width - text.size(), ' ');
  return text;
}

}  // namespace

const char* roleWord(RZShareParticipantPermission permission) {
  switch (permission) {
    case RZShareParticipantPermission::ReadOnly:
      return "viewer";
    case RZShareParticipantPermission::ReadWrite:
      return "editor";
    case RZShareParticipantPermission::None:
      break;
  }
  return "none";
}

std::optional<RZShareParticipantPermission> permissionForRole(const std::string& word) {
  for (const auto permission :
       {RZShareParticipantPermission::None, RZShareParticipantPermission::ReadOnly,
        RZShareParticipantPermission::ReadWrite}) {
    if (word == roleWord(permission)) return permission;
  }
  return std::nullopt;
}

std::string participantLine(const RZShareParticipant& participant) {
  return padded(printableName(participant.userName), 20) + " " + padded(roleOf(participant), 6) +
         " " + statusWord(participant);
}

nlohmann::ordered_json participantJson(const RZShareParticipant& participant) {
  return {{"name", participant.userName},
          {"role", roleOf(participant)},
          {"link", participant.role == RZShareParticipantRole::PublicUser},
          {"status", statusWord(participant)}};
}

std::string shareText(const RZShare& share) {
  if (!share.isKnownToServer()) return "not shared";
  std::string text = printableName(share.title()) + ": a " +
                     (share.type() == RZShareTypeFolder ? "folder" : "document") + " shared by " +
                     printableName(share.ownerName()) + "\n";
  for (const RZShareParticipant& each : share.participants())
    text += "  " + participantLine(each) + "\n";
  text += std::string("everybody with the link: ") + roleWord(share.publicPermission());
  if (const auto url = share.URL()) text += "\n" + printableName(*url);
  return text;
}

nlohmann::ordered_json shareJson(const RZShare& share) {
  nlohmann::ordered_json json{{"shared", share.isKnownToServer()},
                              {"title", share.title()},
                              {"type", share.type()},
                              {"owner", share.ownerName()},
                              {"public", roleWord(share.publicPermission())},
                              {"participants", nlohmann::ordered_json::array()}};
  for (const RZShareParticipant& each : share.participants())
    json["participants"].push_back(participantJson(each));
  if (const auto url = share.URL()) json["url"] = *url;
  return json;
}

}  // namespace yomber
