#include "provider/extension/extension.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <thread>
#include <vector>

#include "platform/foundation/notification_center.h"
#include "platform/ostrell/errors.h"
#include "provider/testing/provider_fixture.h"

namespace yomber {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;

constexpr const char* kGate = "-[QSFileProviderExtension _isLoggedInOrError:]";
constexpr const char* kAccountLine =
    "[DEBUG] received account did update notification, signal changes to fileproviderd";

std::string gateLine(const char* fate, const NSErrorRef& error) {
  return std::string("[ERROR] ") + kGate + ": " + fate +
         " error: " + (error == nullptr ? "(null)" : error->description());
}

class ExtensionTest : public ProviderTest {
 protected:
  /// What the gate answers when it must refuse.
  NSErrorRef refusal() {
    NSErrorRef error;
    EXPECT_FALSE(extension->_isLoggedInOrError(&error));
    EXPECT_NE(error, nullptr);
    return error;
  }
  void expectLoggedOut(const NSErrorRef& error) {
    ASSERT_NE(error, nullptr);
    EXPECT_EQ(domainAndCode(error), "NSFileProviderErrorDomain -1000");
    EXPECT_EQ(error->userInfo().size(), 1U);
    EXPECT_EQ(domainAndCode(error->underlyingError()), domainAndCode(qsc_errorLoggedOut()));
  }

  std::shared_ptr<QSFileProviderExtension> extension = QSFileProviderExtension::init();
};

TEST_F(ExtensionTest, ASignedInAccountPassesTheGateAndLogsNothing) {
  NSErrorRef error;
  EXPECT_TRUE(extension->_isLoggedInOrError(&error));
  EXPECT_EQ(error, nullptr);
  EXPECT_EQ(log.countContaining(kGate), 0U);
}

TEST_F(ExtensionTest, NobodySignedInIsNotAuthenticatedWithTheLoggedOutErrorUnderneath) {
  setAccount({});
  const NSErrorRef error = refusal();
  expectLoggedOut(error);
  EXPECT_EQ(log.count(LogLevel::Error, gateLine("(passed to caller)", error)), 1U);
}

TEST_F(ExtensionTest, AnAccountWithoutAPerAppIdentifierIsTreatedLikeNoAccount) {
  setAccount({.name = "someone", .perAppAccountIdentifier = std::nullopt, .error = nullptr});
  const NSErrorRef error = refusal();
  expectLoggedOut(error);
  EXPECT_EQ(log.count(LogLevel::Error, gateLine("(passed to caller)", error)), 1U);
}

TEST_F(ExtensionTest, TheDaemonsLoggedOutErrorBecomesNotAuthenticated) {
  setAccount({.name = {}, .perAppAccountIdentifier = {}, .error = qsc_errorLoggedOut()});
  const NSErrorRef error = refusal();
  expectLoggedOut(error);
  EXPECT_EQ(log.count(LogLevel::Error, gateLine("(passed to caller)", error)), 1U);
}

TEST_F(ExtensionTest, AnAccountErrorWithoutAMappingPassesUnchanged) {
  setAccount({.name = {},
              .perAppAccountIdentifier = {},
              .error = NSError::errorWithDomain("SomeDomain", 77)});
  EXPECT_EQ(domainAndCode(refusal()), "SomeDomain 77");
}

TEST_F(ExtensionTest, ALostDaemonRefusesWithTheConnectionsError) {
  daemon.stop();
  const NSErrorRef error = refusal();
  EXPECT_NE(domainAndCode(error), "NSFileProviderErrorDomain -1000");
  EXPECT_EQ(log.count(LogLevel::Error, gateLine("(passed to caller)", error)), 1U);
}

TEST_F(ExtensionTest, WithoutAnOutParameterTheGateStillLogsThatTheErrorIsIgnored) {
  setAccount({});
  EXPECT_FALSE(extension->_isLoggedInOrError(nullptr));
  const std::string begin = std::string("[ERROR] ") + kGate + ": (ignored by caller) error: ";
  EXPECT_EQ(log.countContaining(begin), 1U);
}

TEST_F(ExtensionTest, TheAccountIsAskedAfreshAfterAChange) {
  EXPECT_TRUE(extension->_isLoggedInOrError(nullptr));
  setAccount({});
  daemon.postAccountTokenDidChange();
  ASSERT_TRUE(manager.waitForSignals(1));
  EXPECT_FALSE(extension->_isLoggedInOrError(nullptr));
}

TEST_F(ExtensionTest, ThePlaceholderIsAnsweredAtOnceWithNoError) {
  std::vector<NSErrorRef> answers;
  extension->providePlaceholderAtURL(NSURL::fileURLWithPath(inRoot("a")),
                                     [&](NSErrorRef error) { answers.push_back(error); });
  EXPECT_THAT(answers, ElementsAre(nullptr));
  EXPECT_FALSE(NSURL::fileURLWithPath(inRoot("a"))->resourceValues().has_value());
}

TEST_F(ExtensionTest, ThePlaceholderWithoutAHandlerDoesNothing) {
  extension->providePlaceholderAtURL(NSURL::fileURLWithPath(inRoot("a")), nullptr);
  EXPECT_THAT(daemon.calls(), ::testing::Not(::testing::Contains(::testing::Field(
                                  &ScriptedDaemon::Call::method, "itemAtLocation"))));
}

TEST_F(ExtensionTest, AnAccountChangeFromTheDaemonSignalsTheRootOnly) {
  ASSERT_TRUE(daemon.waitUntil([&] { return daemon.observerCount() > 0; }));
  daemon.postAccountTokenDidChange();
  ASSERT_TRUE(manager.waitForSignals(1));
  ASSERT_TRUE(log.waitFor(LogLevel::Debug, kAccountLine));
  EXPECT_THAT(manager.signals(), ElementsAre(NSFileProviderRootContainerItemIdentifier));
  EXPECT_EQ(log.countContaining("[ERROR]"), 0U);
}

TEST_F(ExtensionTest, AFailedSignalOfTheRootIsOnlyLogged) {
  const auto error = NSError::errorWithDomain("SignalDomain", 9);
  manager.setAnswer(error);
  NSNotificationCenter::defaultCenter().postNotificationName(QSAccountTokenDidChangeNotification);
  EXPECT_TRUE(log.waitFor(
      LogLevel::Error,
      "[ERROR] failed to signal enumerator for root container: " + error->description()));
  EXPECT_THAT(manager.signals(), ElementsAre(NSFileProviderRootContainerItemIdentifier));
}

TEST_F(ExtensionTest, TheNotificationCentreDoesNotKeepItAlive) {
  const std::weak_ptr<QSFileProviderExtension> weak = extension;
  extension.reset();
  EXPECT_TRUE(weak.expired());
  NSNotificationCenter::defaultCenter().postNotificationName(QSAccountTokenDidChangeNotification);
  EXPECT_THAT(manager.signals(), IsEmpty());
}

TEST_F(ExtensionTest, AccountChangesAreAnsweredOnManyThreadsWhileItGoesAway) {
  std::vector<std::thread> posters;
  for (int i = 0; i < 4; ++i) {
    posters.emplace_back([] {
      for (int n = 0; n < 100; ++n) {
        NSNotificationCenter::defaultCenter().postNotificationName(
            QSAccountTokenDidChangeNotification);
      }
    });
  }
  for (int n = 0; n < 50; ++n) extension = QSFileProviderExtension::init();
  for (auto& poster : posters) poster.join();
  for (const auto& signal : manager.signals()) {
    EXPECT_EQ(signal, NSFileProviderRootContainerItemIdentifier);
  }
  const std::size_t before = manager.signals().size();
  NSNotificationCenter::defaultCenter().postNotificationName(QSAccountTokenDidChangeNotification);
  EXPECT_EQ(manager.signals().size(), before + 1);
}

}  // namespace
}  // namespace yomber
