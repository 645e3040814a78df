#include <gtest/gtest.h>
#include <signal.h>

#include <algorithm>
#include <memory>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "platform/foundation/fault_points.h"
#include "platform/rozzel/test_store.h"

namespace yomber {
namespace {

using Permission = RZShareParticipantPermission;
using Role = RZShareParticipantRole;
using Status = RZShareParticipantAcceptanceStatus;

const RZRecordZoneID kOwn("share-1");
const RZRecordZoneID kOfAnn("share-1", "ann");

RZShareParticipant invited(const std::string& name, Permission permission = Permission::ReadOnly) {
  return {.userName = name, .permission = permission};
}

/// A store in which Ann shares a zone with one record.
struct SharingStore : TestStore {
  SharingStore() {
    EXPECT_EQ(database()->createZone(kOwn), nullptr);
    EXPECT_EQ(save(database(), {newRecord("item", {{"x", 1}}, kOwn)}), nullptr);
  }

  [[nodiscard]] static RZShare newShare() {
    return {recordID("item", kOwn), RZShareTypeFolder, "Plans", "ann"};
  }
  /// What the store answers when Ann saves it.
  NSErrorRef saveShare(const RZShare& share, RZShareRef* answer = nullptr) const {
    RZShareRef saved;
    NSErrorRef error = database()->saveShare(share, saved);
    if (answer != nullptr) *answer = saved;
    return error;
  }
  [[nodiscard]] RZShareRef share() const {
    RZShareRef share;
    EXPECT_EQ(database()->fetchShare(kOwn, share), nullptr);
    return share;
  }
  [[nodiscard]] NSErrorRef fetchError() const {
    RZShareRef share;
    return database()->fetchShare(kOwn, share);
  }
  /// Ann's share as it is, changed by `edit` and saved.
  template <typename Edit>
  NSErrorRef editShare(const Edit& edit) const {
    RZShare copy = *share();
    auto participants = copy.participants();
    edit(copy, participants);
    copy.setParticipants(participants);
    return saveShare(copy);
  }
  NSErrorRef shareWith(const std::vector<RZShareParticipant>& people,
                       Permission publicPermission = Permission::None) const {
    RZShare share = newShare();
    auto participants = share.participants();
    participants.insert(participants.end(), people.begin(), people.end());
    share.setParticipants(participants);
    share.setPublicPermission(publicPermission);
    return saveShare(share);
  }
  NSErrorRef accept(const std::string& account, const std::string& url,
                    RZShareRef* answer = nullptr) const {
    RZShareRef accepted;
    NSErrorRef error =
        RZContainer(engine(), "com.example.drive", account).acceptShare(url, accepted);
    if (answer != nullptr) *answer = accepted;
    return error;
  }
  NSErrorRef accept(const std::string& account) const { return accept(account, *share()->URL()); }

  [[nodiscard]] bool sees(const std::string& account) const {
    return fetch(sharedDatabase(account), "item", kOfAnn) != nullptr;
  }
  [[nodiscard]] NSErrorRef write(const std::string& account) const {
    return save(sharedDatabase(account), {newRecord("from-" + account, {}, kOfAnn)},
                RZRecordSavePolicy::AllKeys);
  }
  [[nodiscard]] RZShareParticipant participant(const std::string& name) const {
    for (const auto& participant : share()->participants()) {
      if (participant.userName == name) return participant;
    }
    ADD_FAILURE() << name << " does not take part";
    return {};
  }
};

TEST(ShareStoreTest, GivesAShareATagAndAURLAtItsFirstSave) {
  SharingStore store;
  RZShareRef saved;
  ASSERT_EQ(store.saveShare(SharingStore::newShare(), &saved), nullptr);
  ASSERT_TRUE(saved->isKnownToServer());
  ASSERT_TRUE(saved->URL());
  EXPECT_EQ(saved->URL()->size(), std::string("yomber-share:").size() + 32);
  EXPECT_EQ(saved->rootRecordID(), recordID("item", kOwn));
  store.reopen();
  EXPECT_EQ(store.share()->values(), saved->values());
  EXPECT_EQ(store.share()->changeTag(), saved->changeTag());
}

TEST(ShareStoreTest, MakesTheZoneOfAShareWhenThereIsNone) {
  SharingStore store;
  const RZRecordZoneID zone("share-2");
  const RZShare share(recordID("letter", zone), RZShareTypeDocument, "Letter", "ann");
  ASSERT_EQ(store.saveShare(share), nullptr);
  EXPECT_EQ(save(store.database(), {newRecord("letter", {}, zone)}), nullptr);
}

TEST(ShareStoreTest, KeepsTheURLThroughSavesAndGivesANewOneAfterItsEnd) {
  SharingStore store;
  ASSERT_EQ(store.shareWith({}, Permission::ReadOnly), nullptr);
  const std::string url = *store.share()->URL();
  ASSERT_EQ(store.editShare([](auto& share, auto&) { share.setTitle("Renamed"); }), nullptr);
  EXPECT_EQ(store.share()->URL(), url);
  EXPECT_EQ(store.share()->title(), "Renamed");
  ASSERT_EQ(store.database()->destroyShare(*store.share()), nullptr);
  ASSERT_EQ(store.shareWith({}, Permission::ReadOnly), nullptr);
  EXPECT_NE(store.share()->URL(), url);
  EXPECT_TRUE(rz_isError(store.accept("bob", url), RZErrorUnknownItem));
}

TEST(ShareStoreTest, SaysWhetherThereIsAShareOrNotEvenAZone) {
  SharingStore store;
  EXPECT_TRUE(rz_isError(store.fetchError(), RZErrorUnknownItem));
  RZShareRef share;
  EXPECT_TRUE(
      rz_isError(store.database()->fetchShare(RZRecordZoneID("none"), share), RZErrorZoneNotFound));
  EXPECT_TRUE(
      rz_isError(store.sharedDatabase("bob")->fetchShare(kOfAnn, share), RZErrorZoneNotFound));
}

TEST(ShareStoreTest, LetsNobodyInBeforeHeAccepts) {
  SharingStore store;
  ASSERT_EQ(store.shareWith({invited("bob", Permission::ReadWrite)}), nullptr);
  EXPECT_FALSE(store.sees("bob"));
  EXPECT_EQ(store.participant("bob").acceptanceStatus, Status::Pending);
  RZShareRef accepted;
  ASSERT_EQ(store.accept("bob", *store.share()->URL(), &accepted), nullptr);
  EXPECT_EQ(accepted->recordID().zoneID(), kOfAnn);
  EXPECT_EQ(accepted->rootRecordID(), recordID("item", kOfAnn));
  EXPECT_EQ(store.participant("bob").acceptanceStatus, Status::Accepted);
  EXPECT_TRUE(store.sees("bob"));
  EXPECT_EQ(store.write("bob"), nullptr);
}

TEST(ShareStoreTest, LetsNoSaverAcceptForSomebodyElse) {
  SharingStore store;
  RZShareParticipant bob = invited("bob");
  bob.acceptanceStatus = Status::Accepted;
  RZShareParticipant carl = bob;
  carl.userName = "carl";
  carl.role = Role::PublicUser;
  ASSERT_EQ(store.shareWith({bob, carl}), nullptr);
  EXPECT_EQ(store.participant("bob").acceptanceStatus, Status::Pending);
  EXPECT_EQ(store.participant("carl"), invited("carl"));
  EXPECT_FALSE(store.sees("bob"));
  EXPECT_FALSE(store.sees("carl"));
}

TEST(ShareStoreTest, AcceptsOnceMoreWithoutSavingAnything) {
  SharingStore store;
  ASSERT_EQ(store.shareWith({invited("bob")}), nullptr);
  ASSERT_EQ(store.accept("bob"), nullptr);
  const std::string tag = store.share()->changeTag();
  ASSERT_EQ(store.accept("bob"), nullptr);
  EXPECT_EQ(store.share()->changeTag(), tag);
  RZShareRef own;
  ASSERT_EQ(store.accept("ann", *store.share()->URL(), &own), nullptr);
  EXPECT_EQ(own->recordID().zoneID(), kOwn);
  EXPECT_EQ(store.share()->changeTag(), tag);
}

TEST(ShareStoreTest, AnswersThatThereIsNoShareForALinkThatLeadsNowhere) {
  SharingStore store;
  ASSERT_EQ(store.shareWith({}, Permission::ReadOnly), nullptr);
  const std::string url = *store.share()->URL();
  const std::string otherToken = url.substr(0, url.size() - 1) + (url.back() == '0' ? '1' : '0');
  for (const std::string& wrong :
       {std::string(), std::string("yomber-share:"), otherToken, url + "0", "x" + url,
        url.substr(13), std::string(1 << 20, 'a')}) {
    EXPECT_TRUE(rz_isError(store.accept("bob", wrong), RZErrorUnknownItem)) << wrong.substr(0, 60);
  }
  RZShareRef share;
  EXPECT_TRUE(
      rz_isError(RZContainer(store.engine(), "com.example.other", "bob").acceptShare(url, share),
                 RZErrorUnknownItem));
  EXPECT_FALSE(store.sees("bob"));
}

TEST(ShareStoreTest, RefusesWhoeverWasNotAdded) {
  SharingStore store;
  ASSERT_EQ(store.shareWith({invited("bob")}), nullptr);
  const NSErrorRef error = store.accept("carl");
  EXPECT_TRUE(rz_isError(error, RZErrorPermissionFailure));
  EXPECT_NE(error->localizedDescription().find("ask ann"), std::string::npos);
  EXPECT_FALSE(store.sees("carl"));
}

TEST(ShareStoreTest, LetsWhoeverHasALinkInWithThePublicPermission) {
  SharingStore store;
  ASSERT_EQ(store.shareWith({}, Permission::ReadOnly), nullptr);
  ASSERT_EQ(store.accept("carl"), nullptr);
  EXPECT_EQ(store.participant("carl"),
            (RZShareParticipant{"carl", Role::PublicUser, Permission::ReadOnly, Status::Accepted}));
  EXPECT_TRUE(store.sees("carl"));
  EXPECT_TRUE(rz_isError(store.write("carl"), RZErrorPermissionFailure));
}

TEST(ShareStoreTest, ChangesWhatPublicUsersMayWithThePublicPermission) {
  SharingStore store;
  ASSERT_EQ(store.shareWith({}, Permission::ReadOnly), nullptr);
  ASSERT_EQ(store.accept("carl"), nullptr);
  const auto setPublic = [&](Permission permission) {
    return store.editShare([&](auto& share, auto&) { share.setPublicPermission(permission); });
  };
  ASSERT_EQ(setPublic(Permission::ReadWrite), nullptr);
  EXPECT_EQ(store.write("carl"), nullptr);
  ASSERT_EQ(setPublic(Permission::None), nullptr);
  EXPECT_FALSE(store.sees("carl"));
  EXPECT_TRUE(rz_isError(store.accept("carl"), RZErrorPermissionFailure));
  ASSERT_EQ(setPublic(Permission::ReadOnly), nullptr);
  EXPECT_TRUE(store.sees("carl"));
}

TEST(ShareStoreTest, KeepsWhatAPublicUserWasGivenByName) {
  SharingStore store;
  ASSERT_EQ(store.shareWith({}, Permission::ReadOnly), nullptr);
  ASSERT_EQ(store.accept("carl"), nullptr);
  ASSERT_EQ(store.editShare([](auto& share, auto& participants) {
    participants[1].permission = Permission::ReadWrite;
    share.setPublicPermission(Permission::None);
  }),
            nullptr);
  EXPECT_EQ(store.participant("carl").role, Role::PrivateUser);
  EXPECT_EQ(store.write("carl"), nullptr);
}

TEST(ShareStoreTest, ChangesWhatAParticipantMayWithoutAskingHimAgain) {
  SharingStore store;
  ASSERT_EQ(store.shareWith({invited("bob", Permission::ReadWrite)}), nullptr);
  ASSERT_EQ(store.accept("bob"), nullptr);
  ASSERT_EQ(store.write("bob"), nullptr);
  const auto setBobs = [&](Permission permission) {
    return store.editShare(
        [&](auto&, auto& participants) { participants[1].permission = permission; });
  };
  ASSERT_EQ(setBobs(Permission::ReadOnly), nullptr);
  EXPECT_TRUE(store.sees("bob"));
  EXPECT_TRUE(rz_isError(store.write("bob"), RZErrorPermissionFailure));
  ASSERT_EQ(setBobs(Permission::None), nullptr);
  EXPECT_FALSE(store.sees("bob"));
  EXPECT_TRUE(rz_isError(store.accept("bob"), RZErrorPermissionFailure));
  ASSERT_EQ(setBobs(Permission::ReadWrite), nullptr);
  EXPECT_EQ(store.write("bob"), nullptr);
}

TEST(ShareStoreTest, KeepsOutWhoeverHasNoPermissionEvenWithALink) {
  SharingStore store;
  ASSERT_EQ(store.shareWith({invited("bob", Permission::None)}, Permission::ReadWrite), nullptr);
  EXPECT_TRUE(rz_isError(store.accept("bob"), RZErrorPermissionFailure));
  EXPECT_EQ(store.accept("carl"), nullptr);
}

TEST(ShareStoreTest, EndsTheMembershipOfParticipantsWhoAreRemoved) {
  SharingStore store;
  ASSERT_EQ(store.shareWith({invited("bob"), invited("carl")}), nullptr);
  ASSERT_EQ(store.accept("bob"), nullptr);
  ASSERT_EQ(store.accept("carl"), nullptr);
  ASSERT_EQ(store.editShare([](auto&, auto& participants) {
    participants[1].acceptanceStatus = Status::Removed;
    participants.pop_back();
  }),
            nullptr);
  EXPECT_FALSE(store.sees("bob"));
  EXPECT_FALSE(store.sees("carl"));
  EXPECT_TRUE(rz_isError(store.accept("bob"), RZErrorPermissionFailure));
  EXPECT_TRUE(rz_isError(store.accept("carl"), RZErrorPermissionFailure));
}

TEST(ShareStoreTest, AsksWhoeverWasRemovedAgainWhenHeIsAddedAnew) {
  SharingStore store;
  ASSERT_EQ(store.shareWith({invited("bob")}), nullptr);
  ASSERT_EQ(store.accept("bob"), nullptr);
  const auto setStatus = [&](Status status) {
    return store.editShare(
        [&](auto&, auto& participants) { participants[1].acceptanceStatus = status; });
  };
  ASSERT_EQ(setStatus(Status::Removed), nullptr);
  ASSERT_EQ(setStatus(Status::Accepted), nullptr);
  EXPECT_EQ(store.participant("bob").acceptanceStatus, Status::Pending);
  EXPECT_FALSE(store.sees("bob"));
  EXPECT_EQ(store.accept("bob"), nullptr);
  EXPECT_TRUE(store.sees("bob"));
}

TEST(ShareStoreTest, LetsAParticipantLeave) {
  SharingStore store;
  ASSERT_EQ(store.shareWith({invited("bob")}), nullptr);
  RZShareRef bobs;
  ASSERT_EQ(store.accept("bob", *store.share()->URL(), &bobs), nullptr);
  // What the owner saved meanwhile does not keep him.
  ASSERT_EQ(store.editShare([](auto& share, auto&) { share.setTitle("Renamed"); }), nullptr);
  ASSERT_EQ(store.sharedDatabase("bob")->destroyShare(*bobs), nullptr);
  EXPECT_FALSE(store.sees("bob"));
  EXPECT_EQ(store.participant("bob").acceptanceStatus, Status::Removed);
  EXPECT_NE(fetch(store.database(), "item", kOwn), nullptr);
  EXPECT_EQ(store.sharedDatabase("bob")->destroyShare(*bobs), nullptr) << "left already";
}

TEST(ShareStoreTest, LetsWhoeverLeftComeBackByALinkForAll) {
  SharingStore store;
  ASSERT_EQ(store.shareWith({invited("bob", Permission::ReadWrite)}, Permission::ReadOnly),
            nullptr);
  RZShareRef bobs;
  ASSERT_EQ(store.accept("bob", *store.share()->URL(), &bobs), nullptr);
  ASSERT_EQ(store.sharedDatabase("bob")->destroyShare(*bobs), nullptr);
  ASSERT_EQ(store.accept("bob"), nullptr);
  EXPECT_EQ(store.participant("bob").role, Role::PublicUser);
  EXPECT_TRUE(rz_isError(store.write("bob"), RZErrorPermissionFailure));
}

TEST(ShareStoreTest, EndsAllMembershipWithTheShareAndKeepsTheRecords) {
  SharingStore store;
  ASSERT_EQ(store.shareWith({invited("bob")}, Permission::ReadOnly), nullptr);
  ASSERT_EQ(store.accept("bob"), nullptr);
  ASSERT_EQ(store.accept("carl"), nullptr);
  const std::string url = *store.share()->URL();
  ASSERT_EQ(store.database()->destroyShare(*store.share()), nullptr);
  EXPECT_FALSE(store.sees("bob"));
  EXPECT_FALSE(store.sees("carl"));
  EXPECT_NE(fetch(store.database(), "item", kOwn), nullptr);
  EXPECT_TRUE(rz_isError(store.fetchError(), RZErrorUnknownItem));
  EXPECT_TRUE(rz_isError(store.accept("bob", url), RZErrorUnknownItem));
}

TEST(ShareStoreTest, RefusesToDestroyAShareThatWasSavedMeanwhile) {
  SharingStore store;
  ASSERT_EQ(store.shareWith({invited("bob")}), nullptr);
  const RZShareRef stale = store.share();
  ASSERT_EQ(store.accept("bob"), nullptr);
  const NSErrorRef error = store.database()->destroyShare(*stale);
  ASSERT_TRUE(rz_isError(error, RZErrorServerRecordChanged));
  ASSERT_NE(rz_serverRecord(error), nullptr);
  EXPECT_EQ(rz_serverRecord(error)->changeTag(), store.share()->changeTag());
  EXPECT_TRUE(store.sees("bob"));
  ASSERT_EQ(store.database()->destroyShare(*store.share()), nullptr);
  EXPECT_EQ(store.database()->destroyShare(*stale), nullptr) << "destroyed already";
  EXPECT_TRUE(rz_isError(store.saveShare(*stale), RZErrorUnknownItem));
}

TEST(ShareStoreTest, RefusesASaveUnderAStaleTagAndShowsWhatThereIs) {
  SharingStore store;
  ASSERT_EQ(store.shareWith({invited("bob")}), nullptr);
  RZShare mine = *store.share();
  ASSERT_EQ(store.accept("bob"), nullptr);
  mine.setTitle("Mine");
  const NSErrorRef error = store.saveShare(mine);
  ASSERT_TRUE(rz_isError(error, RZErrorServerRecordChanged));
  const RZShareRef current = RZShare::fromRecord(*rz_serverRecord(error));
  ASSERT_NE(current, nullptr);
  EXPECT_EQ(current->participants()[1].acceptanceStatus, Status::Accepted);
  EXPECT_TRUE(rz_isError(store.saveShare(SharingStore::newShare()), RZErrorServerRecordChanged))
      << "a second share of the zone";
  RZShare again = *current;
  again.setTitle("Mine");
  EXPECT_EQ(store.saveShare(again), nullptr);
  EXPECT_EQ(store.share()->title(), "Mine");
}

TEST(ShareStoreTest, LetsParticipantsSaveNothingOfIt) {
  SharingStore store;
  ASSERT_EQ(store.shareWith({invited("bob", Permission::ReadWrite)}), nullptr);
  RZShareRef bobs;
  ASSERT_EQ(store.accept("bob", *store.share()->URL(), &bobs), nullptr);
  RZShareRef saved;
  EXPECT_TRUE(
      rz_isError(store.sharedDatabase("bob")->saveShare(*bobs, saved), RZErrorPermissionFailure));
  const RZDatabaseRef bobsDatabase = store.sharedDatabase("bob");
  RZRecord forged = *bobs;
  forged.setObject(std::int64_t{3}, "rozzel.public-permission");
  EXPECT_TRUE(rz_isError(save(bobsDatabase, {std::make_shared<RZRecord>(forged)}),
                         RZErrorInvalidArguments));
  EXPECT_TRUE(rz_isError(remove(bobsDatabase, bobs->recordID()), RZErrorInvalidArguments));
  const auto disguised = newRecord(RZShareRecordName, {}, kOfAnn);
  EXPECT_TRUE(rz_isError(save(bobsDatabase, {disguised}, RZRecordSavePolicy::AllKeys),
                         RZErrorInvalidArguments));
  EXPECT_EQ(store.share()->changeTag(), bobs->changeTag());
}

TEST(ShareStoreTest, ChangesNoShareByWayOfRecordsForItsOwnerEither) {
  SharingStore store;
  ASSERT_EQ(store.shareWith({}), nullptr);
  EXPECT_TRUE(rz_isError(save(store.database(), {store.share()}, RZRecordSavePolicy::AllKeys),
                         RZErrorInvalidArguments));
  EXPECT_TRUE(
      rz_isError(remove(store.database(), store.share()->recordID()), RZErrorInvalidArguments));
}

TEST(ShareStoreTest, RefusesParticipantsThatNoShareCanHave) {
  SharingStore store;
  ASSERT_EQ(store.shareWith({}), nullptr);
  using People = std::vector<RZShareParticipant>;
  const auto codeFor = [&](const auto& spoil) {
    const NSErrorRef error =
        store.editShare([&](auto&, People& participants) { spoil(participants); });
    return error ? error->code() : 0;
  };
  EXPECT_EQ(codeFor([](People& people) { people.clear(); }), RZErrorInvalidArguments);
  EXPECT_EQ(codeFor([](People& people) { people[0].permission = Permission::None; }),
            RZErrorInvalidArguments);
  EXPECT_EQ(codeFor([](People& people) { people[0].userName = "bob"; }), RZErrorInvalidArguments);
  EXPECT_EQ(codeFor([](People& people) { people.insert(people.begin(), invited("bob")); }),
            RZErrorInvalidArguments);
  EXPECT_EQ(codeFor([](People& people) { people.assign({people[0], people[0]}); }),
            RZErrorInvalidArguments);
  EXPECT_EQ(codeFor([](People& people) { people.assign({people[0], invited("b"), invited("b")}); }),
            RZErrorInvalidArguments);
  EXPECT_EQ(codeFor([](People& people) {
              people.push_back({"bob", Role::Owner, Permission::ReadWrite, Status::Accepted});
            }),
            RZErrorInvalidArguments);
  EXPECT_EQ(codeFor([](People& people) { people.push_back(invited(RZCurrentUserDefaultName)); }),
            RZErrorInvalidArguments);
  EXPECT_EQ(codeFor([](People& people) { people.push_back(invited("")); }),
            RZErrorInvalidArguments);
  EXPECT_EQ(codeFor([](People& people) { people.push_back(invited(std::string(256, 'b'))); }),
            RZErrorLimitExceeded);
  EXPECT_EQ(codeFor([](People& people) { people.push_back(invited("bob")); }), 0);
}

TEST(ShareStoreTest, TakesAThousandParticipantsAndNoMore) {
  SharingStore store;
  std::vector<RZShareParticipant> people;
  while (people.size() + 2 < RZMaximumShareParticipants) {
    people.push_back(invited("user" + std::to_string(people.size())));
  }
  ASSERT_EQ(store.shareWith(people, Permission::ReadOnly), nullptr);
  ASSERT_EQ(store.accept("carl"), nullptr);
  EXPECT_TRUE(rz_isError(store.accept("dora"), RZErrorLimitExceeded));
  EXPECT_EQ(store.accept("user7"), nullptr);
  EXPECT_TRUE(store.sees("user7"));
  const NSErrorRef error = store.editShare(
      [](auto&, auto& participants) { participants.push_back(invited("one too many")); });
  EXPECT_TRUE(rz_isError(error, RZErrorLimitExceeded));
}

TEST(ShareStoreTest, TellsMembersOfTheShareAmongTheZonesChanges) {
  SharingStore store;
  ASSERT_EQ(store.shareWith({invited("bob")}), nullptr);
  ASSERT_EQ(store.accept("bob"), nullptr);
  RZChangePage page;
  ASSERT_EQ(store.sharedDatabase("bob")->fetchChanges(kOfAnn, {}, 10, {}, page), nullptr);
  ASSERT_EQ(page.changes.size(), 2U);
  const RZShareRef share = RZShare::fromRecord(*page.changes[1].record);
  ASSERT_NE(share, nullptr);
  EXPECT_EQ(share->participants(), store.share()->participants());
  const RZChangeToken token = page.token;
  ASSERT_EQ(store.editShare([](auto& edited, auto&) { edited.setTitle("Renamed"); }), nullptr);
  ASSERT_EQ(store.sharedDatabase("bob")->fetchChanges(kOfAnn, token, 10, {}, page), nullptr);
  ASSERT_EQ(page.changes.size(), 1U);
  EXPECT_EQ(RZShare::fromRecord(*page.changes[0].record)->title(), "Renamed");
}

TEST(ShareStoreTest, LosesNoEditOfTwoAccountsAtOnce) {
  SharingStore store;
  constexpr int kPeople = 12;
  ASSERT_EQ(store.shareWith({}, Permission::ReadOnly), nullptr);
  const std::string url = *store.share()->URL();
  // Ann renames the share while others come by its link: each of her saves that lost the race is
  // refused, and made again on what there is then.
  std::thread owner([&] {
    for (int round = 0; round < kPeople; ++round) {
      RZShareRef current = store.share();
      while (true) {
        RZShare renamed = *current;
        renamed.setTitle(renamed.title() + "!");
        const NSErrorRef error = store.saveShare(renamed);
        if (!error) break;
        ASSERT_TRUE(rz_isError(error, RZErrorServerRecordChanged)) << error->description();
        current = RZShare::fromRecord(*rz_serverRecord(error));
      }
    }
  });
  for (int index = 0; index < kPeople; ++index) {
    EXPECT_EQ(store.accept("user" + std::to_string(index), url), nullptr);
  }
  owner.join();
  EXPECT_EQ(store.share()->title(), "Plans" + std::string(kPeople, '!'));
  EXPECT_EQ(store.share()->participants().size(), 1U + kPeople);
  for (int index = 0; index < kPeople; ++index) {
    EXPECT_TRUE(store.sees("user" + std::to_string(index)));
  }
}

TEST(ShareStoreTest, ChangesShareAndMembersTogetherOrNotAtAll) {
  SharingStore store;
  ASSERT_EQ(store.shareWith({invited("bob")}), nullptr);
  ASSERT_EQ(store.accept("bob"), nullptr);
  const std::string tag = store.share()->changeTag();
  const RZShareRef share = store.share();
  store.close();
  const int status = inAnotherProcess([&] {
    store.reopen();
    if (FaultPoint::arm("rozzel.share.written=abort")) return 2;
    return store.database()->destroyShare(*share) ? 3 : 0;
  });
  ASSERT_EQ(status, 128 + SIGABRT);
  store.reopen();
  EXPECT_TRUE(store.sees("bob"));
  EXPECT_EQ(store.share()->changeTag(), tag);
}

TEST(ShareStoreTest, ForgetsALinkWithItsZone) {
  SharingStore store;
  ASSERT_EQ(store.shareWith({}, Permission::ReadWrite), nullptr);
  const std::string url = *store.share()->URL();
  ASSERT_EQ(store.database()->deleteZone(kOwn), nullptr);
  EXPECT_TRUE(rz_isError(store.accept("bob", url), RZErrorUnknownItem));
  ASSERT_EQ(store.database()->createZone(kOwn), nullptr);
  EXPECT_TRUE(rz_isError(store.accept("bob", url), RZErrorUnknownItem));
}

}  // namespace
}  // namespace yomber
