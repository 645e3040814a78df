#include "platform/ostrell/share_wire.h"

#include <capnp/message.h>
#include <capnp/serialize.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <random>
#include <string>
#include <vector>

#include "platform/ostrell/scripted_sharing.h"
#include "platform/rozzel/engine.h"

namespace yomber {
namespace {

using Permission = RZShareParticipantPermission;
using Role = RZShareParticipantRole;
using Status = RZShareParticipantAcceptanceStatus;

RZShareRef fullShare() {
  return RZShare::fromFields(
      {.zoneID = RZRecordZoneID("share-1", "ann"),
       .rootRecordName = "item",
       .changeTag = "a.7",
       .type = RZShareTypeFolder,
       .title = "Pl\xc3\xa4ne \xff",
       .ownerName = "ann",
       .participants = {{"ann", Role::Owner, Permission::ReadWrite, Status::Accepted},
                        {"bob", Role::PrivateUser, Permission::None, Status::Removed},
                        {"carl", Role::PublicUser, Permission::ReadOnly, Status::Accepted}},
       .publicPermission = Permission::ReadOnly,
       .URL = "yomber-share:00ff"});
}

struct WireShare {
  explicit WireShare(const RZShare& share = *fullShare()) { encodeShare(share, builder); }
  [[nodiscard]] RZShareRef decoded() const { return decodeShare(builder.asReader()); }

  capnp::MallocMessageBuilder message;
  protocol::Share::Builder builder = message.initRoot<protocol::Share>();
};

TEST(ShareWireTest, BringsAllOfAShare) {
  const RZShareRef share = fullShare();
  const RZShareRef decoded = WireShare(*share).decoded();
  ASSERT_NE(decoded, nullptr);
  EXPECT_EQ(decoded->values(), share->values());
  EXPECT_EQ(decoded->recordID(), share->recordID());
  EXPECT_EQ(decoded->changeTag(), share->changeTag());
}

TEST(ShareWireTest, BringsAShareThatTheStoreDoesNotKnow) {
  const RZShareRef decoded = WireShare(*scriptedShare("Letter", "")).decoded();
  ASSERT_NE(decoded, nullptr);
  EXPECT_FALSE(decoded->isKnownToServer());
  EXPECT_EQ(decoded->URL(), std::nullopt);
}

TEST(ShareWireTest, RefusesWhatNoShareCanBe) {
  const std::string longName(RZMaximumNameBytes + 1, 'n');
  const auto refused = [](const auto& spoil) {
    WireShare share;
    spoil(share.builder);
    return share.decoded() == nullptr;
  };
  EXPECT_FALSE(refused([](auto&) {}));
  EXPECT_TRUE(refused([](auto& share) { share.setType("other"); }));
  EXPECT_TRUE(refused([](auto& share) { share.setZoneName(""); }));
  EXPECT_TRUE(refused([](auto& share) { share.setZoneOwner(""); }));
  EXPECT_TRUE(refused([&](auto& share) { share.setZoneName(longName.c_str()); }));
  EXPECT_TRUE(refused([](auto& share) { share.setRootRecord(""); }));
  EXPECT_TRUE(refused([](auto& share) { share.setOwnerName("bob"); }));
  EXPECT_TRUE(refused([](auto& share) { share.initParticipants(0); }));
  EXPECT_TRUE(refused([](auto& share) { share.initParticipants(2); }));
  EXPECT_TRUE(refused([](auto& share) { share.setPublicPermission(0); }));
  EXPECT_TRUE(refused([](auto& share) { share.getParticipants()[1].setRole(2); }));
  EXPECT_TRUE(refused([](auto& share) { share.getParticipants()[1].setPermission(256 + 2); }));
  EXPECT_TRUE(
      refused([](auto& share) { share.getParticipants()[1].setAcceptanceStatus(INT64_MIN); }));
  EXPECT_TRUE(
      refused([&](auto& share) { share.getParticipants()[1].setUserName(longName.c_str()); }));
  EXPECT_TRUE(refused([](auto& share) { share.setTitle(std::string(5000, 't').c_str()); }));
  EXPECT_TRUE(refused([](auto& share) { share.setChangeTag(std::string(5000, 't').c_str()); }));
  EXPECT_TRUE(refused([](auto& share) {
    auto list = share.initParticipants(RZMaximumShareParticipants + 1);
    for (auto each : list) each.setUserName("x");
  }));
  capnp::MallocMessageBuilder empty;
  EXPECT_EQ(decodeShare(empty.initRoot<protocol::Share>().asReader()), nullptr);
}

TEST(ShareWireTest, AnswersTheErrorThatWasSentAndOneForNonsense) {
  capnp::MallocMessageBuilder message;
  auto result = message.initRoot<protocol::ShareResult>();
  NSErrorRef error;
  result.initShare();
  EXPECT_EQ(decodeShareResult(result.asReader(), &error), nullptr);
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSXPCConnectionReplyInvalid));
  result.initError().setCode(20);
  EXPECT_EQ(decodeShareResult(result.asReader(), &error), nullptr);
  EXPECT_EQ(error->code(), 20);
}

TEST(ShareWireTest, SurvivesEveryDamageOfAMessage) {
  const WireShare share;
  auto& message = const_cast<capnp::MallocMessageBuilder&>(share.message);
  const auto flat = capnp::messageToFlatArray(message);
  std::mt19937_64 random(7);  // the same damage in every run
  std::size_t understood = 0;
  for (int round = 0; round < 20'000; ++round) {
    auto words = kj::heapArray<capnp::word>(flat.size());
    auto bytes = words.asBytes();
    std::ranges::copy(flat.asBytes(), bytes.begin());
    for (int count = 0; count <= round % 4; ++count) {
      bytes[random() % bytes.size()] = static_cast<kj::byte>(random());
    }
    try {
      capnp::FlatArrayMessageReader reader(words);
      const RZShareRef decoded = decodeShare(reader.getRoot<protocol::Share>());
      if (!decoded) continue;
      ++understood;
      EXPECT_FALSE(decoded->participants().empty());
      EXPECT_LE(decoded->participants().size(), RZMaximumShareParticipants);
    } catch (const kj::Exception&) {
      // A message that is none.
    }
  }
  EXPECT_GT(understood, 0U);
}

}  // namespace
}  // namespace yomber
