#include "platform/ostrell/account.h"

#include <gtest/gtest.h>

#include <atomic>
#include <memory>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "platform/foundation/notification_center.h"
#include "platform/ipc/event_loop.h"
#include "platform/ostrell/awaited.h"
#include "platform/ostrell/constants.h"
#include "platform/ostrell/container.h"
#include "platform/ostrell/daemon_link.h"
#include "platform/ostrell/scripted_daemon.h"

namespace yomber {
namespace {

QSAccountRef account(NSErrorRef* error = nullptr) {
  return QSAccount::currentCachedLoggedInAccountWithError(error);
}

class AccountTest : public testing::Test {
 protected:
  AccountTest() {
    NSNotificationCenter::defaultCenter().addObserver(
        observer, QSAccountTokenDidChangeNotification, [this] {
          onLoopThread = onLoopThread || ipc::EventLoop::shared().isCurrent();
          // What an observer does: it asks, and it waits for queues of its own.
          const auto now = account();
          DaemonLink::current()->replyQueue()->sync([] {});
          notifications->add(now ? now->name() : "nobody");
        });
  }
  ~AccountTest() override { NSNotificationCenter::defaultCenter().removeObserver(observer.get()); }

  void signIn(const std::optional<std::string>& name) {
    daemon.script([&](ScriptedDaemon::Answers& answers) {
      answers.account = [name] { return ScriptedDaemon::Account{name, "here", nullptr}; };
    });
  }

  ScriptedDaemon daemon;
  std::shared_ptr<int> observer = std::make_shared<int>(0);
  std::shared_ptr<Awaited<std::string>> notifications = std::make_shared<Awaited<std::string>>();
  std::atomic<bool> onLoopThread = false;
};

TEST_F(AccountTest, IsAskedForOnce) {
  for (int i = 0; i < 3; ++i) {
    NSErrorRef error;
    const auto current = account(&error);
    ASSERT_TRUE(current);
    EXPECT_EQ(current->name(), "someone");
    EXPECT_EQ(current->perAppAccountIdentifier(), "someone-here");
    EXPECT_FALSE(error);
  }
  EXPECT_EQ(daemon.callCount("account"), 1U);
}

TEST_F(AccountTest, NobodySignedInIsNoErrorAndKept) {
  signIn(std::nullopt);
  for (int i = 0; i < 2; ++i) {
    NSErrorRef error;
    EXPECT_FALSE(account(&error));
    EXPECT_FALSE(error);
  }
  EXPECT_EQ(daemon.callCount("account"), 1U);
}

TEST_F(AccountTest, AnEmptyPerAppIdentifierIsNone) {
  daemon.script([](ScriptedDaemon::Answers& answers) {
    answers.account = [] { return ScriptedDaemon::Account{"someone", std::nullopt, nullptr}; };
  });
  ASSERT_TRUE(account());
  EXPECT_FALSE(account()->perAppAccountIdentifier());
}

TEST_F(AccountTest, AnErrorIsHandedOnAndNotKept) {
  daemon.script([](ScriptedDaemon::Answers& answers) {
    answers.account = [] {
      return ScriptedDaemon::Account{{}, {}, NSError::errorWithDomain(QSOstrellErrorDomain, 3)};
    };
  });
  NSErrorRef error;
  EXPECT_FALSE(account(&error));
  ASSERT_TRUE(error);
  EXPECT_TRUE(error->is(QSOstrellErrorDomain, 3));
  signIn("someone");
  EXPECT_TRUE(account());
}

TEST_F(AccountTest, WithoutADaemonThereIsAnError) {
  daemon.stop();
  NSErrorRef error;
  EXPECT_FALSE(account(&error));
  EXPECT_TRUE(error);
  EXPECT_FALSE(account());  // no one to tell
}

TEST_F(AccountTest, AChangeEmptiesTheCacheBeforeItIsAnnounced) {
  QSAccount::startAccountTokenChangeObserverIfNeeded();
  QSAccount::startAccountTokenChangeObserverIfNeeded();
  EXPECT_EQ(account()->name(), "someone");
  signIn("other");
  daemon.postAccountTokenDidChange();
  EXPECT_EQ(notifications->wait(), std::vector<std::string>{"other"});
  EXPECT_EQ(daemon.callCount("account"), 2U);
  EXPECT_EQ(daemon.observerCount(), 1U);
  EXPECT_FALSE(onLoopThread);
}

TEST_F(AccountTest, AReplyFromBeforeAChangeIsNotKept) {
  ASSERT_TRUE(account());
  signIn("other");
  daemon.postAccountTokenDidChange();
  ASSERT_EQ(notifications->wait().size(), 1U);
  // Empty the cache again, and have a query of "other" under way while the account changes once
  // more.
  daemon.postAccountTokenDidChange();
  ASSERT_EQ(notifications->wait(2).size(), 2U);
  NSNotificationCenter::defaultCenter().removeObserver(observer.get());
  DaemonLink::current()->accountCache().empty();
  daemon.forgetCalls();
  daemon.hold("account");
  Awaited<std::string> asked;
  std::thread query([&] { asked.add(account()->name()); });
  ASSERT_TRUE(daemon.waitForCalls("account"));
  signIn("third");
  const auto generation = DaemonLink::current()->accountCache().generation();
  auto again = std::make_shared<int>(0);
  Awaited<int> announced;
  NSNotificationCenter::defaultCenter().addObserver(again, QSAccountTokenDidChangeNotification,
                                                    [&] { announced.add(1); });
  daemon.postAccountTokenDidChange();
  ASSERT_EQ(announced.wait().size(), 1U);
  EXPECT_NE(DaemonLink::current()->accountCache().generation(), generation);
  daemon.release("account");
  query.join();
  EXPECT_EQ(asked.values(), std::vector<std::string>{"other"});
  EXPECT_EQ(account()->name(), "third");
  NSNotificationCenter::defaultCenter().removeObserver(again.get());
}

TEST_F(AccountTest, ALossEmptiesTheCacheAndTheReturnIsAnnounced) {
  QSAccount::startAccountTokenChangeObserverIfNeeded();
  EXPECT_EQ(account()->name(), "someone");
  daemon.stop();
  signIn("other");
  daemon.start();
  // Nobody asks: the library finds the daemon again by itself.
  EXPECT_EQ(notifications->wait(), std::vector<std::string>{"other"});
  EXPECT_EQ(daemon.observerCount(), 1U);
}

TEST_F(AccountTest, ADaemonThatComesLateIsAnnounced) {
  daemon.stop();
  QSAccount::startAccountTokenChangeObserverIfNeeded();
  EXPECT_FALSE(account());
  daemon.start();
  EXPECT_EQ(notifications->wait(), std::vector<std::string>{"someone"});
}

TEST_F(AccountTest, TheFirstConnectionIsNoChange) {
  QSAccount::startAccountTokenChangeObserverIfNeeded();
  ASSERT_TRUE(account());
  signIn("other");
  daemon.postAccountTokenDidChange();
  EXPECT_EQ(notifications->wait(), std::vector<std::string>{"other"});
}

TEST_F(AccountTest, ManyThreadsAskWhileTheAccountChanges) {
  ASSERT_TRUE(account());
  std::vector<std::thread> threads;
  std::atomic<bool> isOver = false;
  for (int i = 0; i < 8; ++i) {
    threads.emplace_back([&] {
      while (!isOver) (void)account();
    });
  }
  for (int round = 1; round <= 20; ++round) {
    const std::string name = "account " + std::to_string(round);
    signIn(name);
    daemon.postAccountTokenDidChange();
    const auto told = notifications->wait(static_cast<std::size_t>(round));
    EXPECT_EQ(told.size(), static_cast<std::size_t>(round));
    EXPECT_EQ(told.empty() ? "" : told.back(), name);
    EXPECT_EQ(account()->name(), name);
  }
  isOver = true;
  for (auto& thread : threads) thread.join();
}

}  // namespace
}  // namespace yomber
