#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <vector>

#include "provider/testing/sharing_fixture.h"

namespace yomber {
namespace {

using Share = ScriptedSharingAnswers::Share;

// ---- Saving ------------------------------------------------------------------------------------

TEST_F(SharingProxyTest, SavingAnswersTheShareAsItIsSavedAndKeepsIt) {
  const auto progress = save(scriptedShare("five.txt", ""));
  ASSERT_NE(progress, nullptr);
  const RZShareRef saved = answer().share;
  ASSERT_NE(saved, nullptr);
  EXPECT_TRUE(saved->isKnownToServer());
  EXPECT_EQ(progress->completedUnitCount(), 1);
  expectLines({opening("saveShare:completion:"), replyLine(saved->description() + ", (null)")});
  EXPECT_EQ(fetch(), nullptr);
  EXPECT_EQ(answer(2).share, saved);
}

TEST_F(SharingProxyTest, WhatIsBeingSavedIsWhatAFetchAnswers) {
  const auto unsaved = scriptedShare("five.txt", "");
  daemon.hold("saveShare");
  save(unsaved);
  ASSERT_TRUE(daemon.waitForCalls("saveShare"));
  EXPECT_EQ(fetch(), nullptr);
  EXPECT_EQ(answer().share, unsaved);
  daemon.release("saveShare");
  EXPECT_NE(answer(2).share, unsaved);
}

TEST_F(SharingProxyTest, ASaveThatFailsKeepsNothing) {
  daemon.scriptSharing([](ScriptedSharingAnswers& answers) {
    answers.saveShare = [](const RZShareRef&) {
      return Share{.share = {}, .error = rz_error(RZErrorServerRecordChanged, "stale")};
    };
  });
  save(scriptedShare("five.txt"));
  EXPECT_EQ(answer().share, nullptr);
  EXPECT_EQ(domainAndCode(answer().error), "RZErrorDomain 14");
  EXPECT_NE(fetch(), nullptr) << "asks anew";
  answer(2);
}

TEST_F(SharingProxyTest, SavingAFoldersShareIsRefusedForEveryIdentifier) {
  daemon.addItem(scriptedFolder(6, "Plans"), makeFolder("Plans"));
  for (const char* const identifier : {"d:5", "i:6"}) {
    proxy = proxyFor(identifier);
    EXPECT_EQ(save(scriptedShare("Plans", "1", RZShareTypeFolder)), nullptr);
    EXPECT_EQ(shares->values().back().share, nullptr);
    EXPECT_EQ(domainAndCode(shares->values().back().error), "NSPOSIXErrorDomain 45");
  }
  EXPECT_EQ(daemon.callCount("saveShare"), 0U);
  EXPECT_NE(fetch(), nullptr) << "it is not kept";
  answer(3);
}

TEST_F(SharingProxyTest, CancellingASaveCallsItOff) {
  daemon.hold("saveShare");
  const auto progress = save(scriptedShare("five.txt"));
  ASSERT_TRUE(daemon.waitForCalls("saveShare"));
  progress->cancel();
  expectCancelled(answer().error);
  EXPECT_TRUE(daemon.waitForCalls("saveShare.dropped"));
  daemon.release("saveShare");
}

// ---- Unsharing ---------------------------------------------------------------------------------

TEST_F(SharingProxyTest, UnsharingWhatWasNeverSharedIsNoErrorAndStaysAtNothingDone) {
  const auto progress = unshare();
  EXPECT_EQ(only(errors), nullptr);
  waitForOperations();
  EXPECT_EQ(progress->completedUnitCount(), 0);
  EXPECT_EQ(progress->totalUnitCount(), 2);
  EXPECT_EQ(daemon.callCount("destroyShare"), 0U);
  EXPECT_EQ(log.count(LogLevel::Debug, replyLine("(null)")), 1U);
}

TEST_F(SharingProxyTest, ACopyThatBringsNeitherAShareNorAReasonIsNotTakenForAnUnsharedItem) {
  daemon.scriptSharing([](ScriptedSharingAnswers& answers) {
    answers.copyShare = [](const std::string&) { return Share{}; };
  });
  fetch();
  const ShareAnswer nothing = answer();
  EXPECT_EQ(nothing.share, nullptr);
  ASSERT_NE(nothing.error, nullptr);
  EXPECT_TRUE(nothing.error->is(NSCocoaErrorDomain, NSXPCConnectionReplyInvalid));
  EXPECT_EQ(daemon.callCount("newShare"), 0U);
  unshare();
  waitForOperations();
  EXPECT_EQ(daemon.callCount("destroyShare"), 0U);
  EXPECT_NE(fetch(), nullptr) << "nothing was kept";
  answer(2);
}

TEST_F(SharingProxyTest, UnsharingMovesFromNothingOverOneToTwoAndRepliesBeforeTheLastStep) {
  shareIs(scriptedShare("five.txt"));
  daemon.hold("copyShare");
  daemon.hold("destroyShare");
  const auto shown = std::make_shared<NSProgressRef>();
  const auto seen = std::make_shared<Awaited<std::int64_t>>();
  const auto progress = proxy->unshareWithCompletion([shown, seen](const NSErrorRef& error) {
    EXPECT_EQ(error, nullptr);
    seen->add((*shown)->completedUnitCount());
  });
  *shown = progress;
  ASSERT_TRUE(daemon.waitForCalls("copyShare"));
  EXPECT_EQ(progress->completedUnitCount(), 0);
  daemon.release("copyShare");
  ASSERT_TRUE(daemon.waitForCalls("destroyShare"));
  EXPECT_EQ(progress->completedUnitCount(), 1);
  daemon.release("destroyShare");
  EXPECT_EQ(seen->wait(), std::vector<std::int64_t>{1});
  waitForOperations();
  EXPECT_EQ(progress->completedUnitCount(), 2);
  expectLines({opening("unshareWithCompletion:"), opening("fetchShareWithCompletion:"),
               replyLine("(null)")});
}

TEST_F(SharingProxyTest, UnsharingForgetsTheShareWhenItBeginsToDestroy) {
  shareIs(scriptedShare("five.txt"));
  fetch();
  answer();
  daemon.hold("destroyShare");
  unshare();
  ASSERT_TRUE(daemon.waitForCalls("destroyShare"));
  EXPECT_NE(fetch(), nullptr) << "asks anew";
  answer(2);
  daemon.release("destroyShare");
  EXPECT_EQ(only(errors), nullptr);
}

TEST_F(SharingProxyTest, UnsharingPassesTheErrorOfTheFetchOn) {
  copyingFailsWith(refusal);
  const auto progress = unshare();
  EXPECT_EQ(domainAndCode(only(errors)), "RZErrorDomain 12");
  EXPECT_EQ(progress->completedUnitCount(), 0);
}

TEST_F(SharingProxyTest, UnsharingPassesTheErrorOfTheDestructionOn) {
  shareIs(scriptedShare("five.txt"));
  daemon.scriptSharing([this](ScriptedSharingAnswers& answers) {
    answers.destroyShare = [error = refusal](const RZShareRef&) { return error; };
  });
  const auto progress = unshare();
  EXPECT_EQ(domainAndCode(only(errors)), "RZErrorDomain 12");
  waitForOperations();
  EXPECT_EQ(progress->completedUnitCount(), 2);
}

TEST_F(SharingProxyTest, AFoldersShareIsDestroyedByAnIdentifierOfAFolderAlone) {
  shareIs(scriptedShare("Plans", "1", RZShareTypeFolder));
  const auto progress = unshare();
  EXPECT_EQ(domainAndCode(only(errors)), "NSPOSIXErrorDomain 45");
  EXPECT_EQ(progress->completedUnitCount(), 0);
  EXPECT_EQ(daemon.callCount("destroyShare"), 0U);
  addFolder(6, "Plans");
  proxy = proxyFor("i:6");
  unshare();
  const auto all = errors->wait(2);
  ASSERT_EQ(all.size(), 2U);
  EXPECT_EQ(all[1], nullptr);
  EXPECT_EQ(daemon.callCount("destroyShare"), 1U);
}

TEST_F(SharingProxyTest, CancellingAnUnsharingThatFetchesCallsTheFetchOff) {
  shareIs(scriptedShare("five.txt"));
  daemon.hold("copyShare");
  const auto progress = unshare();
  ASSERT_TRUE(daemon.waitForCalls("copyShare"));
  progress->cancel();
  expectCancelled(only(errors));
  EXPECT_TRUE(daemon.waitForCalls("copyShare.dropped"));
  EXPECT_EQ(daemon.callCount("destroyShare"), 0U);
  daemon.release("copyShare");
}

TEST_F(SharingProxyTest, CancellingAnUnsharingThatDestroysCallsTheDestructionOff) {
  shareIs(scriptedShare("five.txt"));
  daemon.hold("destroyShare");
  const auto progress = unshare();
  ASSERT_TRUE(daemon.waitForCalls("destroyShare"));
  progress->cancel();
  expectCancelled(only(errors));
  EXPECT_TRUE(daemon.waitForCalls("destroyShare.dropped"));
  daemon.release("destroyShare");
}

TEST_F(SharingProxyTest, CancellingTheUnsharingOfAKeptShareCallsItsDestructionOff) {
  shareIs(scriptedShare("five.txt"));
  fetch();
  answer();
  daemon.hold("destroyShare");
  const auto progress = unshare();
  EXPECT_EQ(progress->completedUnitCount(), 1) << "begun before the call returned";
  ASSERT_TRUE(daemon.waitForCalls("destroyShare"));
  progress->cancel();
  expectCancelled(only(errors));
  daemon.release("destroyShare");
}

TEST_F(SharingProxyTest, AnOperationOutlivesTheConnectionsProxy) {
  shareIs(scriptedShare("five.txt"));
  daemon.hold("copyShare");
  fetch();
  ASSERT_TRUE(daemon.waitForCalls("copyShare"));
  const std::weak_ptr<QSSharingProxy> weak = proxy;
  proxy.reset();
  daemon.release("copyShare");
  EXPECT_NE(answer().share, nullptr);
  waitForOperations();
  EXPECT_TRUE(daemon.waitUntil([&] { return weak.expired(); }));
}

}  // namespace
}  // namespace yomber
