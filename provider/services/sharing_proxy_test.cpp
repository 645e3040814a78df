#include "provider/services/sharing_proxy.h"

#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <vector>

#include "platform/ostrell/errors.h"
#include "provider/testing/gate.h"
#include "provider/testing/sharing_fixture.h"

namespace yomber {
namespace {

using Share = ScriptedSharingAnswers::Share;

/// `itemFlagShared` of protocols/common.capnp.
constexpr std::uint32_t kSharedItemFlag = 16;

// ---- fetchSharingInfo and the preflight --------------------------------------------------------

struct SharingInfoTest : SharingProxyTest {
  struct Info {
    bool isShared = false;
    NSFileProviderItemRef item;
    NSErrorRef error;
  };

  Info info(QSSharingProxy& asked) {
    std::vector<Info> infos;
    asked.fetchSharingInfo(
        [&](bool isShared, const NSFileProviderItemRef& item, const NSErrorRef& error) {
          infos.push_back({isShared, item, error});
        });
    EXPECT_EQ(infos.size(), 1U) << "on the calling thread";
    return infos.empty() ? Info{} : infos.front();
  }
  Info preflight(QSSharingProxy& asked) {
    std::vector<Info> infos;
    EXPECT_EQ(asked.preflightCheckIfCurrentlyShareableWithCompletion(
                  [&](bool isShared, const NSFileProviderItemRef& item, const auto& first,
                      const auto& second, const NSErrorRef& error) {
                    EXPECT_TRUE(first.empty() && second.empty());
                    infos.push_back({isShared, item, error});
                  }),
              nullptr);
    EXPECT_EQ(infos.size(), 1U) << "on the calling thread";
    return infos.empty() ? Info{} : infos.front();
  }
  void shareTheItem() {
    ItemFields item = scriptedDocument(5, "five.txt");
    item.flags |= kSharedItemFlag;
    daemon.addItem(item, inRoot("five.txt"));
  }
};

TEST_F(SharingInfoTest, SaysWhetherTheItemIsShared) {
  EXPECT_FALSE(info(*proxy).isShared);
  shareTheItem();
  log.forget();
  const Info shared = info(*proxy);
  EXPECT_TRUE(shared.isShared);
  EXPECT_EQ(shared.item, nullptr);
  EXPECT_EQ(shared.error, nullptr);
  expectLines({opening("fetchSharingInfo:"), replyLine("1, (null), (null)"), "[INFO] ┗# "});
}

TEST_F(SharingInfoTest, OfAnItemThatIsGoneIsItsError) {
  const auto gone = proxyFor("d:77");
  EXPECT_EQ(missingIdentifier(info(*gone).error), "d:77");
  EXPECT_EQ(missingIdentifier(preflight(*gone).error), "d:77");
  EXPECT_FALSE(info(*gone).isShared);
}

TEST_F(SharingInfoTest, PassesTheErrorOfAReadOn) {
  failLookupsWith(refusal);
  EXPECT_EQ(domainAndCode(info(*proxy).error), "RZErrorDomain 12");
  EXPECT_EQ(domainAndCode(preflight(*proxy).error), "RZErrorDomain 12");
}

TEST_F(SharingInfoTest, ThePreflightSaysTheSameAndNothingOfShareability) {
  EXPECT_FALSE(preflight(*proxy).isShared);
  shareTheItem();
  log.forget();
  const Info shared = preflight(*proxy);
  EXPECT_TRUE(shared.isShared);
  EXPECT_EQ(shared.item, nullptr);
  EXPECT_EQ(shared.error, nullptr);
  expectLines({opening("preflightCheckIfCurrentlyShareableWithCompletion:"),
               replyLine("1, (null), (null), (null), (null)"), "[INFO] ┗# "});
  EXPECT_EQ(daemon.callCount("checkIfShareable"), 0U);
}

TEST_F(SharingProxyTest, PreparingOpensAndClosesItsSectionAndDoesNothingElse) {
  ASSERT_TRUE(daemon.waitForCalls("observe"));  // which is how the extension connects
  daemon.forgetCalls();
  proxy->startPreparingForShareWhenForcing(true);
  EXPECT_EQ(log.texts(), (std::vector<std::string>{opening("startPreparingForShareWhenForcing:"),
                                                   "[INFO] ┗# "}));
  EXPECT_EQ(log.sectionOf("[INFO] ┗# ") % 2, 0U) << "an info section";
  EXPECT_TRUE(daemon.calls().empty());
}

// ---- fetchShare --------------------------------------------------------------------------------

TEST_F(SharingProxyTest, AnItemThatWasNeverSharedGetsAFreshShareAndNoError) {
  const auto progress = fetch();
  ASSERT_NE(progress, nullptr);
  const ShareAnswer fresh = answer();
  ASSERT_NE(fresh.share, nullptr);
  EXPECT_EQ(fresh.error, nullptr);
  EXPECT_FALSE(fresh.share->isKnownToServer());
  EXPECT_EQ(daemon.callCount("newShare"), 1U);
  EXPECT_NE(fetch(), nullptr) << "a fresh share is not kept";
  answer(2);
  EXPECT_EQ(daemon.callCount("copyShare"), 2U);
}

TEST_F(SharingProxyTest, TheStoresUnknownItemMeansNotSharedEvenBelowAnotherError) {
  copyingFailsWith(NSError::errorWithDomain(
      QSOstrellErrorDomain, 3, {{NSUnderlyingErrorKey, rz_error(RZErrorUnknownItem, "gone")}}));
  fetch();
  EXPECT_NE(answer().share, nullptr);
  EXPECT_EQ(answer().error, nullptr);
}

TEST_F(SharingProxyTest, AFreshShareThatCannotBeMadeIsItsError) {
  daemon.scriptSharing([this](ScriptedSharingAnswers& answers) {
    answers.newShare = [error = refusal](const std::string&) {
      return Share{.share = {}, .error = error};
    };
  });
  fetch();
  EXPECT_EQ(answer().share, nullptr);
  EXPECT_EQ(domainAndCode(answer().error), "RZErrorDomain 12");
}

TEST_F(SharingProxyTest, AnyOtherErrorIsPassedOn) {
  copyingFailsWith(refusal);
  fetch();
  EXPECT_EQ(answer().share, nullptr);
  EXPECT_EQ(domainAndCode(answer().error), "RZErrorDomain 12");
  EXPECT_EQ(daemon.callCount("newShare"), 0U);
  EXPECT_NE(fetch(), nullptr);
}

TEST_F(SharingProxyTest, ASecondFetchAnswersAtOnceWithoutTheDaemon) {
  shareIs(scriptedShare("five.txt"));
  fetch();
  const RZShareRef first = answer().share;
  ASSERT_NE(first, nullptr);
  daemon.forgetCalls();
  log.forget();
  EXPECT_EQ(fetch(), nullptr);
  ASSERT_EQ(shares->values().size(), 2U) << "on the calling thread";
  EXPECT_EQ(shares->values()[1].share, first);
  EXPECT_TRUE(daemon.calls().empty());
  EXPECT_EQ(log.texts(),
            (std::vector<std::string>{opening("fetchShareWithCompletion:"),
                                      replyLine(first->description() + ", (null)"), "[INFO] ┗# "}));
}

TEST_F(SharingProxyTest, EachConnectionKeepsAShareOfItsOwn) {
  shareIs(scriptedShare("five.txt"));
  fetch();
  answer();
  proxy = proxyFor("d:5");
  EXPECT_NE(fetch(), nullptr);
  answer(2);
}

TEST_F(SharingProxyTest, TheShareOfAFolderAboveIsAnsweredAndNotKept) {
  shareIs(scriptedShare("Plans", "1", RZShareTypeFolder), inRoot("Plans"));
  fetch();
  ASSERT_NE(answer().share, nullptr);
  EXPECT_NE(fetch(), nullptr);
  answer(2);
  EXPECT_EQ(daemon.callCount("copyShare"), 2U);
}

TEST_F(SharingProxyTest, TheProgressOfAFetchNeverShowsCompletion) {
  shareIs(scriptedShare("five.txt"));
  const auto progress = fetch();
  answer();
  waitForOperations();
  EXPECT_EQ(progress->totalUnitCount(), 1);
  EXPECT_EQ(progress->completedUnitCount(), 0);
  EXPECT_TRUE(progress->isCancellable());
}

TEST_F(SharingProxyTest, TheReplyOfAFetchIsLoggedAfterItsSection) {
  shareIs(scriptedShare("five.txt"));
  daemon.hold("copyShare");
  fetch();
  ASSERT_TRUE(daemon.waitForCalls("copyShare"));
  EXPECT_EQ(among(log.texts(), {"[INFO] ┗# "}).size(), 1U) << "closed when the method returned";
  daemon.release("copyShare");
  const auto share = answer().share;
  expectLines({opening("fetchShareWithCompletion:"), "[INFO] ┗# ",
               replyLine(share->description() + ", (null)")});
}

TEST_F(SharingProxyTest, WithoutALocationTheOperationsErrorIsTheAnswer) {
  proxy = proxyFor("d:77");
  EXPECT_NE(fetch(), nullptr);
  EXPECT_EQ(domainAndCode(answer().error), "NSCocoaErrorDomain 4");
  EXPECT_EQ(daemon.callCount("copyShare"), 0U);
}

TEST_F(SharingProxyTest, CancellingAFetchCallsItOff) {
  daemon.hold("copyShare");
  const auto progress = fetch();
  ASSERT_TRUE(daemon.waitForCalls("copyShare"));
  progress->cancel();
  expectCancelled(answer().error);
  EXPECT_TRUE(daemon.waitForCalls("copyShare.dropped"));
  daemon.release("copyShare");
}

TEST_F(SharingProxyTest, CancellingAFetchThatHasEndedDoesNothing) {
  shareIs(scriptedShare("five.txt"));
  const auto progress = fetch();
  answer();
  waitForOperations();
  progress->cancel();
  EXPECT_EQ(shares->values().size(), 1U);
}

TEST_F(SharingProxyTest, AFetchWithoutAReplyIsHarmless) {
  shareIs(scriptedShare("five.txt"));
  EXPECT_NE(proxy->fetchShareWithCompletion({}), nullptr);
  waitForOperations();
  EXPECT_EQ(proxy->fetchShareWithCompletion({}), nullptr);
}

// ---- Participants ------------------------------------------------------------------------------

struct ParticipantsTest : SharingProxyTest {
  struct People {
    std::vector<RZShareParticipant> participants;
    std::int64_t publicPermission = -1;
    NSErrorRef error;
  };
  NSProgressRef ask() {
    return proxy->fetchParticipantListAndPublicPermission(
        [into = people](const auto& participants, std::int64_t permission,
                        const NSErrorRef& error) { into->add({participants, permission, error}); });
  }
  const std::shared_ptr<Awaited<People>> people = std::make_shared<Awaited<People>>();
};

TEST_F(ParticipantsTest, AreThoseOfTheShare) {
  const auto share = std::make_shared<RZShare>(*scriptedShare("five.txt"));
  share->setPublicPermission(RZShareParticipantPermission::ReadOnly);
  shareIs(share);
  EXPECT_NE(ask(), nullptr);
  const auto answers = people->wait();
  ASSERT_EQ(answers.size(), 1U);
  EXPECT_EQ(answers[0].participants, share->participants());
  EXPECT_EQ(answers[0].publicPermission, 2);
  EXPECT_EQ(answers[0].error, nullptr);
  expectLines({opening("fetchParticipantListAndPublicPermission:"),
               opening("fetchShareWithCompletion:"), replyLine(share->description() + ", (null)"),
               replyLine("(" + share->participants()[0].description() + "), 2, (null)")});
  EXPECT_EQ(ask(), nullptr) << "of the kept share";
  EXPECT_EQ(people->values().size(), 2U);
}

TEST_F(ParticipantsTest, AreNoneWithAnError) {
  copyingFailsWith(refusal);
  ask();
  const auto answers = people->wait();
  ASSERT_EQ(answers.size(), 1U);
  EXPECT_TRUE(answers[0].participants.empty());
  EXPECT_EQ(answers[0].publicPermission, 0);
  EXPECT_EQ(domainAndCode(answers[0].error), "RZErrorDomain 12");
  EXPECT_EQ(log.countContaining("reply((null), 0, "), 1U);
}

TEST_F(ParticipantsTest, AreCancelledWithTheFetch) {
  daemon.hold("copyShare");
  const auto progress = ask();
  ASSERT_TRUE(daemon.waitForCalls("copyShare"));
  progress->cancel();
  const auto answers = people->wait();
  ASSERT_EQ(answers.size(), 1U);
  expectCancelled(answers[0].error);
  daemon.release("copyShare");
}

// ---- The link ----------------------------------------------------------------------------------

struct ShareURLTest : SharingProxyTest {
  struct Link {
    NSURLRef url;
    NSErrorRef error;
    std::int64_t completed = 0;
  };
  NSProgressRef ask() {
    NSProgressRef progress;
    const auto started = std::make_shared<Gate>();
    const auto shown = std::make_shared<NSProgressRef>();
    progress = proxy->fetchShareURLWithCompletion(
        [into = links, started, shown](const NSURLRef& url, const NSErrorRef& error) {
          // A type that cannot be read is answered before there is a progress.
          if (url) (void)started->wait();
          into->add({url, error, url ? (*shown)->completedUnitCount() : 0});
        });
    *shown = progress;
    started->open();
    return progress;
  }
  const std::shared_ptr<Awaited<Link>> links = std::make_shared<Awaited<Link>>();
};

TEST_F(ShareURLTest, IsFetchedForTheItemAndItsType) {
  daemon.scriptSharing([](ScriptedSharingAnswers& answers) {
    answers.copyShareURL = [](const std::string&, const std::string&) {
      return ScriptedSharingAnswers::Text{.text = "yomber-share:00ff"};
    };
  });
  EXPECT_NE(ask(), nullptr);
  const auto answers = links->wait();
  ASSERT_EQ(answers.size(), 1U);
  EXPECT_EQ(answers[0].url->absoluteString(), "yomber-share:00ff");
  EXPECT_EQ(answers[0].completed, 1) << "before the reply";
  EXPECT_EQ(daemon.calls().back(),
            (ScriptedDaemon::Call{"copyShareURL", {inRoot("five.txt"), "text/plain"}}));
  expectLines({opening("fetchShareURLWithCompletion:"), replyLine("yomber-share:00ff, (null)")});
}

TEST_F(ShareURLTest, WithoutATypeIsTheErrorOfTheType) {
  failLookupsWith(refusal);
  EXPECT_EQ(ask(), nullptr);
  ASSERT_EQ(links->values().size(), 1U) << "on the calling thread";
  EXPECT_EQ(domainAndCode(links->values()[0].error), "RZErrorDomain 12");
  EXPECT_EQ(daemon.callCount("copyShareURL"), 0U);
}

TEST_F(ShareURLTest, WithoutALocationTheOperationsErrorIsTheAnswer) {
  proxy = proxyFor("d:77");
  EXPECT_NE(ask(), nullptr);
  ASSERT_EQ(links->wait().size(), 1U);
  EXPECT_EQ(domainAndCode(links->values()[0].error), "NSCocoaErrorDomain 4");
}

TEST_F(ShareURLTest, PassesTheDaemonsErrorOn) {
  EXPECT_NE(ask(), nullptr);
  ASSERT_EQ(links->wait().size(), 1U);
  EXPECT_EQ(domainAndCode(links->values()[0].error), "QSOstrellErrorDomain 20");
}

TEST_F(ShareURLTest, IsCalledOffWithItsProgress) {
  daemon.hold("copyShareURL");
  const auto progress = ask();
  ASSERT_TRUE(daemon.waitForCalls("copyShareURL"));
  progress->cancel();
  ASSERT_EQ(links->wait().size(), 1U);
  expectCancelled(links->values()[0].error);
  EXPECT_TRUE(daemon.waitForCalls("copyShareURL.dropped"));
  daemon.release("copyShareURL");
}

}  // namespace
}  // namespace yomber
