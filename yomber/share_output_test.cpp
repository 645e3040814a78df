#include "yomber/share_output.h"

#include <gtest/gtest.h>

#include <nlohmann/json.hpp>

namespace yomber {
namespace {

RZShareParticipant person(const std::string& name, RZShareParticipantPermission permission,
                          RZShareParticipantAcceptanceStatus status) {
  return {.userName = name, .permission = permission, .acceptanceStatus = status};
}

RZShareRef plans() {
  RZShare::Fields fields{.zoneID = RZRecordZoneID("share-1")};
  fields.rootRecordName = "5";
  fields.changeTag = "1";
  fields.type = RZShareTypeFolder;
  fields.title = "Plans";
  fields.ownerName = "ann";
  fields.participants = {{.userName = "ann",
                          .role = RZShareParticipantRole::Owner,
                          .permission = RZShareParticipantPermission::ReadWrite,
                          .acceptanceStatus = RZShareParticipantAcceptanceStatus::Accepted},
                         person("bob", RZShareParticipantPermission::ReadOnly,
                                RZShareParticipantAcceptanceStatus::Pending)};
  fields.publicPermission = RZShareParticipantPermission::ReadWrite;
  fields.URL = "yomber-share:abc";
  return RZShare::fromFields(fields);
}

TEST(ShareOutputTest, RolesHaveWordsAndWordsHaveRoles) {
  for (const char* const word : {"viewer", "editor", "none"}) {
    const auto permission = permissionForRole(word);
    ASSERT_TRUE(permission) << word;
    EXPECT_STREQ(roleWord(*permission), word);
  }
  EXPECT_FALSE(permissionForRole("owner"));
}

TEST(ShareOutputTest, AShareIsShownWithItsPeopleAndItsLink) {
  const RZShareRef share = plans();
  ASSERT_TRUE(share);
  EXPECT_EQ(shareText(*share),
            "Plans: a folder shared by ann\n"
            "  ann                  owner  accepted\n"
            "  bob                  viewer pending\n"
            "everybody with the link: editor\n"
            "yomber-share:abc");
}

TEST(ShareOutputTest, AShareIsOneObject) {
  EXPECT_EQ(shareJson(*plans()).dump(),
            R"({"shared":true,"title":"Plans","type":"folder","owner":"ann","public":"editor",)"
            R"("participants":[{"name":"ann","role":"owner","link":false,"status":"accepted"},)"
            R"({"name":"bob","role":"viewer","link":false,"status":"pending"}],)"
            R"("url":"yomber-share:abc"})");
}

TEST(ShareOutputTest, ANewShareIsNoShareYet) {
  const RZShare share(RZRecordID("5", RZRecordZoneID("share-1")), RZShareTypeDocument, "a", "ann");
  EXPECT_EQ(shareText(share), "not shared");
  EXPECT_FALSE(shareJson(share)["shared"].get<bool>());
}

TEST(ShareOutputTest, NamesCannotActOnATerminal) {
  EXPECT_EQ(participantLine(person("e\x1b[31mve", RZShareParticipantPermission::None,
                                   RZShareParticipantAcceptanceStatus::Removed)),
            "e\\x1b[31mve          none   removed");
}

}  // namespace
}  // namespace yomber
