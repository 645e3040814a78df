#include "fileproviderd/extension_supervisor.h"

#include <gtest/gtest.h>

#include <numeric>

#include "fileproviderd/fake_clock.h"
#include "fileproviderd/host_errors.h"
#include "platform/fileprovider/constants.h"

namespace yomber {
namespace {

using namespace std::chrono_literals;

/// What the launched extensions do.
struct Script {
  bool knowsRoot = true;
  bool answers = true;
  NSErrorRef launchError;
};

class FakeSession final : public ExtensionSession {
 public:
  FakeSession(ManualExecutor& executor, const Script& script, ExtensionEvents given, pid_t pid)
      : events(std::move(given)), executor_(executor), script_(script), pid_(pid) {}

  void end() override { hasEnded = true; }
  [[nodiscard]] pid_t pid() const override { return pid_; }
  [[nodiscard]] std::size_t enumeratorCount() const override { return 0; }
  void locate(const std::string& identifier, std::chrono::milliseconds /*limit*/,
              AnswerHandler<std::string> handler) override {
    EXPECT_EQ(identifier, NSFileProviderRootContainerItemIdentifier);
    ++rootsAsked;
    executor_.post([handler = std::move(handler), script = script_] {
      if (!script.answers) {
        return handler(std::nullopt,
                       NSError::errorWithDomain(NSCocoaErrorDomain, NSXPCConnectionTimedOut), true);
      }
      handler(script.knowsRoot ? std::optional<std::string>("/root") : std::nullopt, nullptr,
              false);
    });
  }
  void identify(const std::string&, AnswerHandler<std::string>) override {}
  void item(const std::string&, AnswerHandler<ItemFields>) override {}
  void enumerator(const std::string&, EnumeratorHandler) override {}
  void openEnumerator(const std::string&,
                      std::function<void(ipc::Remote<protocol::Enumerator>, NSErrorRef)>) override {
  }
  [[nodiscard]] ipc::Remote<protocol::Extension> remote() const override { return nullptr; }

  const ExtensionEvents events;
  bool hasEnded = false;
  int rootsAsked = 0;

 private:
  ManualExecutor& executor_;
  const Script& script_;
  const pid_t pid_;
};

class FakeLauncher final : public ExtensionLauncher {
 public:
  explicit FakeLauncher(ManualExecutor& executor) : executor_(executor) {}
  ExtensionSessionRef launch(ExtensionEvents events, NSErrorRef* error) override {
    if (script.launchError != nullptr) {
      ++failures;
      storeError(error, script.launchError);
      return nullptr;
    }
    launched.push_back(std::make_shared<FakeSession>(executor_, script, std::move(events),
                                                     static_cast<pid_t>(launched.size() + 1)));
    return launched.back();
  }
  Script script;
  std::vector<std::shared_ptr<FakeSession>> launched;
  int failures = 0;

 private:
  ManualExecutor& executor_;
};

class FakeProbe final : public DaemonProbe {
 public:
  explicit FakeProbe(ManualExecutor& executor) : executor_(executor) {}
  void probe(std::function<void(NSErrorRef)> handler) override {
    ++asked;
    if (isStuck) return kept_.push_back(std::move(handler));
    executor_.post(
        [this, handler = std::move(handler)] { handler(isUp ? nullptr : zarnNotRunningError()); });
  }
  bool isUp = true;
  bool isStuck = false;
  int asked = 0;

 private:
  ManualExecutor& executor_;
  std::vector<std::function<void(NSErrorRef)>> kept_;
};

class ExtensionSupervisorTest : public testing::Test {
 protected:
  struct Answer {
    bool came = false;
    ExtensionSessionRef session;
    NSErrorRef error;
  };

  std::shared_ptr<Answer> acquire() {
    auto answer = std::make_shared<Answer>();
    supervisor->acquire([answer](ExtensionSessionRef session, NSErrorRef error) {
      EXPECT_FALSE(answer->came) << "answered twice";
      *answer = {true, std::move(session), std::move(error)};
    });
    return answer;
  }
  std::shared_ptr<Answer> acquireAndRun() {
    auto answer = acquire();
    EXPECT_TRUE(executor.drain());
    return answer;
  }
  void pass(std::chrono::milliseconds time) {
    clock.advance(time, [this] { (void)executor.drain(); });
    EXPECT_TRUE(executor.drain());
  }
  void crash() {
    const auto session = launcher.launched.back();
    session->events.didEnd(extensionUnavailableError("was ended by signal 9"));
  }

  ManualExecutor executor;
  FakeClock clock;
  FakeLauncher launcher{executor};
  FakeProbe probe{executor};
  int ends = 0;
  std::vector<std::string> signalled;
  std::shared_ptr<ExtensionSupervisor> supervisor = std::make_shared<ExtensionSupervisor>(
      launcher, probe, clock,
      ExtensionSupervisor::Events{
          .didEnd = [this](const NSErrorRef&) { ++ends; },
          .didSignal = [this](const std::string& container) { signalled.push_back(container); }},
      [] { return 0.0; }, ExtensionSupervisor::Limits{});
};

TEST_F(ExtensionSupervisorTest, StartsOnDemandAndOnlyOnce) {
  EXPECT_EQ(launcher.launched.size(), 0U);
  const auto first = acquire();
  const auto second = acquire();
  EXPECT_TRUE(executor.drain());
  ASSERT_NE(first->session, nullptr);
  EXPECT_EQ(first->session, second->session);
  EXPECT_EQ(launcher.launched.size(), 1U);
  EXPECT_EQ(acquire()->session, first->session) << "a running one is had at once";
  EXPECT_EQ(supervisor->startCount(), 1U);
}

TEST_F(ExtensionSupervisorTest, StartsNothingWhileZarnIsDownAndSaysWhatToDo) {
  probe.isUp = false;
  const auto answer = acquireAndRun();
  ASSERT_TRUE(answer->came);
  EXPECT_EQ(answer->session, nullptr);
  EXPECT_EQ(answer->error->localizedDescription(),
            "zarn is not running: start the drive with 'yomber up'");
  EXPECT_EQ(launcher.launched.size(), 0U);
  EXPECT_EQ(supervisor->lastFailure(), answer->error);
  probe.isUp = true;
  EXPECT_NE(acquireAndRun()->session, nullptr);
  EXPECT_EQ(supervisor->lastFailure(), nullptr);
}

TEST_F(ExtensionSupervisorTest, AsksForTheRootOnceAndStartsAfreshWhenItIsUnknown) {
  launcher.script.knowsRoot = false;
  const auto answer = acquireAndRun();
  EXPECT_FALSE(answer->came) << "it waits for the next attempt";
  EXPECT_EQ(launcher.launched[0]->rootsAsked, 1);
  EXPECT_TRUE(launcher.launched[0]->hasEnded);
  launcher.script.knowsRoot = true;
  pass(50ms);
  ASSERT_TRUE(answer->came);
  EXPECT_EQ(answer->session, launcher.launched.at(1));
  EXPECT_FALSE(launcher.launched[1]->hasEnded);
  EXPECT_EQ(ends, 0) << "nobody had used the first one";
}

TEST_F(ExtensionSupervisorTest, EveryRequestIsAnsweredWithinItsTime) {
  launcher.script.knowsRoot = false;
  const auto answer = acquireAndRun();
  pass(8s);
  ASSERT_TRUE(answer->came);
  EXPECT_NE(answer->error->localizedDescription().find("root"), std::string::npos);

  probe.isStuck = true;
  launcher.script.knowsRoot = true;
  pass(10s);
  const auto stuck = acquireAndRun();
  pass(8s);
  EXPECT_TRUE(stuck->came) << "also when zarn is stuck";
}

TEST_F(ExtensionSupervisorTest, RestartsWithBackoffUpToFiveSeconds) {
  launcher.script.knowsRoot = false;
  const auto waiting = acquireAndRun();
  for (int i = 0; i < 40; ++i) {
    (void)acquire();
    pass(3s);
  }
  // 50, 100, 200 … 5000 and then one every five seconds.
  EXPECT_GT(launcher.launched.size(), 20U);
  EXPECT_LT(launcher.launched.size(), 40U);
}

TEST_F(ExtensionSupervisorTest, TheBackoffBeginsAnewAfterAnExtensionStayedUp) {
  (void)acquireAndRun();
  const auto restartTakes = [&] {
    crash();
    const auto answer = acquire();
    auto time = 0ms;
    while (!answer->came) {
      pass(10ms);
      time += 10ms;
    }
    EXPECT_NE(answer->session, nullptr);
    return time;
  };
  EXPECT_EQ(restartTakes(), 50ms);
  EXPECT_EQ(restartTakes(), 100ms);
  EXPECT_EQ(restartTakes(), 200ms);
  pass(2s);
  EXPECT_EQ(restartTakes(), 50ms);
}

TEST_F(ExtensionSupervisorTest, SaysWhenAnExtensionInUseEnds) {
  (void)acquireAndRun();
  const auto old = launcher.launched.back();
  crash();
  EXPECT_EQ(ends, 1);
  EXPECT_EQ(supervisor->session(), nullptr);
  EXPECT_NE(supervisor->lastFailure(), nullptr);
  pass(10s);
  EXPECT_EQ(launcher.launched.size(), 1U) << "nobody needs one";
  (void)acquireAndRun();
  old->events.didSignal("i:1");
  old->events.didEnd(extensionUnavailableError("again"));
  EXPECT_TRUE(signalled.empty()) << "the dead are not listened to";
  EXPECT_EQ(ends, 1);
  launcher.launched.back()->events.didSignal("i:2");
  EXPECT_EQ(signalled, (std::vector<std::string>{"i:2"}));
}

TEST_F(ExtensionSupervisorTest, AProgramThatCannotBeStartedIsTriedAgain) {
  launcher.script.launchError = NSError::errorWithErrno(2, "/no/such/program");
  const auto answer = acquireAndRun();
  pass(8s);
  ASSERT_TRUE(answer->came);
  EXPECT_EQ(answer->error, launcher.script.launchError);
  EXPECT_GT(launcher.failures, 3);
  EXPECT_LT(launcher.failures, 15);
}

TEST_F(ExtensionSupervisorTest, EndsAnExtensionThatDoesNotAnswer) {
  (void)acquireAndRun();
  pass(60s);
  EXPECT_FALSE(launcher.launched[0]->hasEnded) << "one that answers is left alone";
  launcher.script.answers = false;
  pass(15s);
  EXPECT_TRUE(launcher.launched[0]->hasEnded);
  EXPECT_EQ(ends, 1);
}

TEST_F(ExtensionSupervisorTest, ATimedOutCallLeadsToACheckAtOnce) {
  (void)acquireAndRun();
  const auto session = launcher.launched[0];
  session->events.didTimeOut();
  session->events.didTimeOut();
  EXPECT_EQ(session->rootsAsked, 2) << "one at the start, one for both";
  EXPECT_TRUE(executor.drain());
  EXPECT_FALSE(session->hasEnded) << "it was only slow";
  launcher.script.answers = false;
  session->events.didTimeOut();
  EXPECT_TRUE(executor.drain());
  EXPECT_TRUE(session->hasEnded);
}

TEST(Backoff, IsShortenedAtRandom) {
  double random = 0.999;
  Backoff backoff([&] { return random; });
  EXPECT_EQ(backoff.next(), 37ms);
  random = 0.0;
  EXPECT_EQ(backoff.next(), 100ms);
  backoff.reset();
  EXPECT_EQ(backoff.next(), 50ms);
  const auto system = Backoff::systemRandom();
  for (int i = 0; i < 100; ++i) {
    const double drawn = system();
    EXPECT_GE(drawn, 0.0);
    EXPECT_LT(drawn, 1.0);
  }
}

}  // namespace
}  // namespace yomber
