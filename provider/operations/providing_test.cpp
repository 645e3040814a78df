#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <thread>
#include <vector>

#include "platform/foundation/fault_attributes.h"
#include "platform/foundation/file_manager.h"
#include "platform/ostrell/errors.h"
#include "provider/testing/gate.h"
#include "provider/testing/operations_fixture.h"

namespace yomber {
namespace {

using ::testing::Contains;
using ::testing::IsEmpty;
using Call = ScriptedDaemon::Call;

constexpr const char* kGranted = "[DEBUG] url exists, granting the read";
constexpr const char* kTakenEntry =
    "[CRIT] Assertion failed: _downloadOperationByPath[path] == nil";
constexpr const char* kMissingEntry =
    "[CRIT] Assertion failed: self->_downloadOperationByPath[path]";
constexpr NSFileCoordinatorReadingOptions kForced = 0x20000;

class ProvidingTest : public OperationsTest {
 protected:
  void provide(const std::string& name, NSFileCoordinatorReadingOptions options = 0) {
    extension->startProvidingItemAtURL(urlInRoot(name), options, into(errors));
  }
  static std::string startLine(const std::string& path, const std::string& options = "none") {
    return "[DEBUG] ┣# start providing " + path + " (readingOptions: " + options + ")";
  }
  void failProvidingWith(const NSErrorRef& error) {
    daemon.scriptContent([&](ScriptedContentAnswers& answers) {
      answers.startProviding = [error](const std::string&, std::uint64_t) { return error; };
    });
  }
};

TEST_F(ProvidingTest, ReadsOutsideTheTreeAreGrantedWithoutALine) {
  extension->startProvidingItemAtURL(NSURL::fileURLWithPath("/etc/passwd"), kForced, into(errors));
  EXPECT_EQ(errors->values(), std::vector<NSErrorRef>{nullptr});
  extension->startProvidingItemAtURL(nullptr, 0, into(errors));
  EXPECT_EQ(errors->values().size(), 2U);
  EXPECT_THAT(log.lines(), IsEmpty());
  EXPECT_EQ(daemon.callCount("startProviding"), 0U);
}

TEST_F(ProvidingTest, AFileThatIsHereIsGrantedAtOnceAndItsSectionStaysOpen) {
  makeFile("here.txt");
  provide("here.txt");
  EXPECT_EQ(errors->values(), std::vector<NSErrorRef>{nullptr});
  EXPECT_EQ(log.texts(), (std::vector<std::string>{startLine(inRoot("here.txt")), kGranted}));
  EXPECT_EQ(log.sectionOf(startLine(inRoot("here.txt"))) % 2, 1U);
  EXPECT_EQ(daemon.callCount("startProviding"), 0U);
}

TEST_F(ProvidingTest, AFileThatIsNotHereIsProvidedAndItsSectionClosedAfterTheHandler) {
  bool wasClosedInHandler = true;
  Gate answered;
  const std::string start = startLine(inRoot("gone.txt"));
  extension->startProvidingItemAtURL(urlInRoot("gone.txt"), 0, [&](const NSErrorRef& error) {
    errors->add(error);
    wasClosedInHandler = isClosed(start);
    answered.open();
  });
  ASSERT_TRUE(answered.wait());
  EXPECT_EQ(errors->values(), std::vector<NSErrorRef>{nullptr});
  EXPECT_FALSE(wasClosedInHandler);
  ASSERT_TRUE(log.waitFor(LogLevel::Debug, "[DEBUG] ┗# "));
  EXPECT_EQ(log.texts(),
            (std::vector<std::string>{start, "[DEBUG] ┳# item providing completion; (null)",
                                      "[DEBUG] ┗# "}));
  EXPECT_TRUE(isClosed(start));
  EXPECT_EQ(log.sectionOf(start), log.sectionOf("[DEBUG] ┳# item providing completion; (null)"));
  EXPECT_THAT(daemon.calls(), Contains(Call{"startProviding", {inRoot("gone.txt"), "0"}}));
}

TEST_F(ProvidingTest, AFaultIsProvidedAlthoughItsFileIsThere) {
  const std::string path = makeFile("fault.txt");
  NSErrorRef failure;
  if (!NSFileManager::defaultManager().setExtendedAttribute(path, kFaultAttribute, "1", &failure)) {
    GTEST_SKIP() << "no extended attributes in " << path << ": " << failure->description();
  }
  provide("fault.txt");
  EXPECT_EQ(only(errors), nullptr);
  EXPECT_EQ(log.countContaining(kGranted), 0U);
  EXPECT_EQ(daemon.callCount("startProviding"), 1U);
}

TEST_F(ProvidingTest, WithTheForcingBitAFileThatIsHereIsProvidedAllTheSame) {
  makeFile("here.txt");
  provide("here.txt", kForced | 1);
  EXPECT_EQ(only(errors), nullptr);
  EXPECT_EQ(log.countContaining(kGranted), 0U);
  EXPECT_EQ(
      log.count(LogLevel::Debug, startLine(inRoot("here.txt"), "WithoutChanges|ForcesProviding")),
      1U);
  EXPECT_THAT(daemon.calls(), Contains(Call{"startProviding", {inRoot("here.txt"), "131073"}}));
}

TEST_F(ProvidingTest, OtherBitsForceNothing) {
  makeFile("here.txt");
  provide("here.txt", ~kForced);
  EXPECT_EQ(only(errors), nullptr);
  EXPECT_EQ(daemon.callCount("startProviding"), 0U);
}

TEST_F(ProvidingTest, APromiseIsOddButProvidedAlsoWhenAFileIsThere) {
  const std::string path = daemon.home() + "/tree/.Promises/5";
  std::ofstream(path) << "there";
  extension->startProvidingItemAtURL(NSURL::fileURLWithPath(path), 0, into(errors));
  EXPECT_EQ(only(errors), nullptr);
  EXPECT_EQ(
      log.count(LogLevel::Error, "[ERROR] Someone tries to coordinate at the side fault URL '" +
                                     path + "', odd, but allow it"),
      1U);
  EXPECT_EQ(log.countContaining(kGranted), 0U);
  EXPECT_THAT(daemon.calls(), Contains(Call{"startProviding", {path, "0"}}));
}

TEST_F(ProvidingTest, WithoutOptionsTheyAreZero) {
  extension->startProvidingItemAtURL(urlInRoot("gone.txt"), into(errors));
  EXPECT_EQ(only(errors), nullptr);
  EXPECT_THAT(daemon.calls(), Contains(Call{"startProviding", {inRoot("gone.txt"), "0"}}));
}

TEST_F(ProvidingTest, TheFrameworkGetsTheMappedErrorAndTheLogTheOther) {
  const auto error = NSError::errorWithDomain(NSCocoaErrorDomain, 4354);
  failProvidingWith(error);
  provide("gone.txt");
  EXPECT_EQ(domainAndCode(only(errors)), "NSFileProviderErrorDomain -1003");
  EXPECT_EQ(
      log.count(LogLevel::Debug, "[DEBUG] ┳# item providing completion; " + error->description()),
      1U);
}

TEST_F(ProvidingTest, NobodyNeedsToBeSignedIn) {
  setAccount({});
  provide("gone.txt");
  EXPECT_EQ(only(errors), nullptr);
  EXPECT_EQ(daemon.callCount("account"), 0U);
}

TEST_F(ProvidingTest, WithoutAHandlerEverythingElseHappens) {
  makeFile("here.txt");
  extension->startProvidingItemAtURL(NSURL::fileURLWithPath("/etc/passwd"), nullptr);
  extension->startProvidingItemAtURL(urlInRoot("here.txt"), nullptr);
  extension->startProvidingItemAtURL(urlInRoot("gone.txt"), nullptr);
  EXPECT_TRUE(log.waitFor(LogLevel::Debug, "[DEBUG] ┗# "));
  EXPECT_EQ(daemon.callCount("startProviding"), 1U);
}

TEST_F(ProvidingTest, ALostDaemonIsAnError) {
  daemon.hold("startProviding");
  provide("gone.txt");
  ASSERT_TRUE(daemon.waitForCalls("startProviding"));
  daemon.dropConnections();
  EXPECT_EQ(domainAndCode(only(errors)), "QSOstrellErrorDomain 4");
}

// ---- The table of what runs ---------------------------------------------------------------------

TEST_F(ProvidingTest, OnceItHasEndedAStopFindsItNoMore) {
  daemon.hold("startProviding");
  provide("gone.txt");
  ASSERT_TRUE(daemon.waitForCalls("startProviding"));
  daemon.release("startProviding");
  EXPECT_EQ(only(errors), nullptr);
  extension->stopProvidingItemAtURL(urlInRoot("gone.txt"));
  EXPECT_THAT(daemon.calls(), Contains(Call{"evict", {inRoot("gone.txt")}}));
  EXPECT_EQ(daemon.callCount("startProviding.dropped"), 0U);
}

TEST_F(ProvidingTest, ASecondRequestForAPathRunsBesideTheFirst) {
  daemon.hold("startProviding");
  provide("gone.txt");
  EXPECT_EQ(log.count(LogLevel::Fault, kTakenEntry), 0U);
  provide("gone.txt", kForced);
  EXPECT_EQ(log.count(LogLevel::Fault, kTakenEntry), 1U);
  ASSERT_TRUE(daemon.waitForCalls("startProviding", 2));
  EXPECT_EQ(log.count(LogLevel::Fault, kMissingEntry), 0U);
  daemon.release("startProviding");
  EXPECT_EQ(errors->wait(2), (std::vector<NSErrorRef>{nullptr, nullptr}));
  EXPECT_EQ(log.count(LogLevel::Fault, kMissingEntry), 1U);
}

TEST_F(ProvidingTest, OfTwoForAPathAStopReachesTheLaterOnly) {
  daemon.hold("startProviding");
  provide("gone.txt", 1);
  ASSERT_TRUE(daemon.waitForCalls("startProviding", 1));
  provide("gone.txt", 2);
  ASSERT_TRUE(daemon.waitForCalls("startProviding", 2));
  extension->stopProvidingItemAtURL(urlInRoot("gone.txt"));
  ASSERT_TRUE(daemon.waitForCalls("startProviding.dropped"));
  EXPECT_THAT(daemon.calls(), Contains(Call{"startProviding.dropped", {inRoot("gone.txt"), "2"}}));
  EXPECT_EQ(domainAndCode(only(errors)), "NSCocoaErrorDomain 3072");
  daemon.release("startProviding");
  EXPECT_EQ(errors->wait(2).size(), 2U);
  EXPECT_EQ(errors->values().back(), nullptr);
}

TEST_F(ProvidingTest, DifferentPathsAreProvidedBesideEachOther) {
  daemon.hold("startProviding");
  for (int i = 0; i < 20; ++i) provide("gone" + std::to_string(i));
  ASSERT_TRUE(daemon.waitForCalls("startProviding", 20));
  daemon.release("startProviding");
  EXPECT_EQ(errors->wait(20), std::vector<NSErrorRef>(20));
  EXPECT_EQ(log.countContaining("[CRIT]"), 0U);
}

TEST_F(ProvidingTest, EveryHandlerIsCalledOnceHoweverStartsAndStopsMeet) {
  constexpr int kThreads = 4;
  constexpr int kRequests = 50;
  std::vector<std::thread> threads;
  for (int thread = 0; thread < kThreads; ++thread) {
    threads.emplace_back([&] {
      for (int i = 0; i < kRequests; ++i) {
        const std::string name = "gone" + std::to_string(i % 5);
        provide(name);
        extension->stopProvidingItemAtURL(urlInRoot(name));
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(errors->wait(kThreads * kRequests).size(), std::size_t{kThreads * kRequests});
  for (const auto& error : errors->values()) {
    EXPECT_TRUE(error == nullptr || error->is(NSCocoaErrorDomain, NSUserCancelledError))
        << error->description();
  }
}

}  // namespace
}  // namespace yomber
