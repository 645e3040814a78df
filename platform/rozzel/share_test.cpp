#include "platform/rozzel/share.h"

#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <vector>

namespace yomber {
namespace {

using Permission = RZShareParticipantPermission;
using Role = RZShareParticipantRole;
using Status = RZShareParticipantAcceptanceStatus;

const RZRecordZoneID kSharedZone("share-1");

RZShare::Fields goodFields() {
  return {.zoneID = kSharedZone,
          .rootRecordName = "item",
          .changeTag = "1.2",
          .type = RZShareTypeFolder,
          .title = "Plans",
          .ownerName = "ann",
          .participants = {{"ann", Role::Owner, Permission::ReadWrite, Status::Accepted},
                           {"bob", Role::PrivateUser, Permission::ReadOnly, Status::Pending}},
          .publicPermission = Permission::ReadOnly,
          .URL = "yomber-share:1"};
}

TEST(ShareTest, BelongsToItsMakerAndToNobodyElseAtFirst) {
  const RZShare share(RZRecordID("item", kSharedZone), RZShareTypeDocument, "Letter.txt", "ann");
  EXPECT_EQ(share.rootRecordID(), RZRecordID("item", kSharedZone));
  EXPECT_EQ(share.ownerName(), "ann");
  EXPECT_EQ(share.title(), "Letter.txt");
  EXPECT_EQ(share.publicPermission(), Permission::None);
  EXPECT_EQ(share.URL(), std::nullopt);
  EXPECT_FALSE(share.isKnownToServer());
  ASSERT_EQ(share.participants().size(), 1U);
  EXPECT_EQ(share.participants()[0],
            (RZShareParticipant{"ann", Role::Owner, Permission::ReadWrite, Status::Accepted}));
  EXPECT_EQ(*share.valueForKey<std::string>(RZShareTypeKey), RZShareTypeDocument);
}

TEST(ShareTest, SaysAllThatItWasMadeFrom) {
  const RZShare::Fields fields = goodFields();
  const RZShareRef share = RZShare::fromFields(fields);
  ASSERT_NE(share, nullptr);
  EXPECT_EQ(share->recordID(), RZRecordID(RZShareRecordName, kSharedZone));
  EXPECT_EQ(share->rootRecordID().recordName(), fields.rootRecordName);
  EXPECT_EQ(share->changeTag(), fields.changeTag);
  EXPECT_EQ(share->type(), fields.type);
  EXPECT_EQ(share->title(), fields.title);
  EXPECT_EQ(share->ownerName(), fields.ownerName);
  EXPECT_EQ(share->participants(), fields.participants);
  EXPECT_EQ(share->publicPermission(), fields.publicPermission);
  EXPECT_EQ(share->URL(), fields.URL);
  EXPECT_TRUE(share->isKnownToServer());
}

TEST(ShareTest, ChangesInACopyAlone) {
  const RZShareRef share = RZShare::fromFields(goodFields());
  RZShare copy = *share;
  copy.setPublicPermission(Permission::None);
  copy.setParticipants({share->participants().front()});
  EXPECT_EQ(copy.participants().size(), 1U);
  EXPECT_EQ(share->participants().size(), 2U);
  EXPECT_EQ(share->publicPermission(), Permission::ReadOnly);
  EXPECT_EQ(copy.changeTag(), share->changeTag());
}

TEST(ShareTest, KeepsNamesThatNoTextCouldHold) {
  RZShare share = *RZShare::fromFields(goodFields());
  auto participants = share.participants();
  participants[1].userName = std::string("b \0\xff", 4);
  share.setParticipants(participants);
  EXPECT_EQ(share.participants(), participants);
}

TEST(ShareTest, IsNotMadeFromWhatNoShareCanBe) {
  const auto refused = [](const auto& spoil) {
    RZShare::Fields fields = goodFields();
    spoil(fields);
    return RZShare::fromFields(fields) == nullptr;
  };
  EXPECT_TRUE(refused([](auto& fields) { fields.type = "other"; }));
  EXPECT_TRUE(refused([](auto& fields) { fields.rootRecordName = ""; }));
  EXPECT_TRUE(refused([](auto& fields) { fields.ownerName = "bob"; }));
  EXPECT_TRUE(refused([](auto& fields) { fields.participants.clear(); }));
  EXPECT_TRUE(refused([](auto& fields) { fields.participants[0].role = Role::PrivateUser; }));
  EXPECT_TRUE(refused([](auto& fields) { fields.participants[1].userName = ""; }));
  EXPECT_TRUE(refused([](auto& fields) { fields.participants[1].role = static_cast<Role>(2); }));
  EXPECT_TRUE(refused(
      [](auto& fields) { fields.participants[1].permission = static_cast<Permission>(7); }));
  EXPECT_TRUE(refused(
      [](auto& fields) { fields.participants[1].acceptanceStatus = static_cast<Status>(-1); }));
  EXPECT_TRUE(refused(
      [](auto& fields) { fields.participants[1].permission = static_cast<Permission>(256 + 2); }));
  EXPECT_TRUE(refused([](auto& fields) {
    fields.participants[1].permission = static_cast<Permission>(INT64_MAX);
  }));
  EXPECT_TRUE(refused([](auto& fields) { fields.publicPermission = static_cast<Permission>(4); }));
  EXPECT_FALSE(refused([](auto&) {}));
}

TEST(ShareTest, IsNotMadeFromOtherRecords) {
  const RZRecord document("document", RZRecordID(RZShareRecordName, kSharedZone));
  EXPECT_EQ(RZShare::fromRecord(document), nullptr);
  RZRecord broken = *RZShare::fromFields(goodFields());
  broken.setObject(std::int64_t{1}, RZShareTypeKey);
  EXPECT_EQ(RZShare::fromRecord(broken), nullptr);
}

}  // namespace
}  // namespace yomber
