#include "zarn/daemon_server.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "platform/foundation/gate.h"
#include "platform/ostrell/constants.h"
#include "zarn/test_daemon.h"
#include "zarn/test_waiting.h"

namespace yomber::test {
namespace {

using testing::ElementsAre;

/// That a document has been uploaded is a change like any other, and told. Its store is out of
/// reach here, so that nothing is told but what a test does.
class DaemonWatchingTest : public DaemonTest {
 protected:
  void upSignedIn(Drive::Options options = {}) {
    up(std::move(options));
    std::ofstream(paths_.store + "/offline").put('x');
    ASSERT_EQ(signIn("ada"), nullptr);
  }
  void reachStore() {
    fs::remove(paths_.store + "/offline");
    drive_->engine->retryNow();
  }
  /// What could be uploaded has been.
  [[nodiscard]] bool waitForUploads() {
    return drive_->engine->waitUntilIdle(std::chrono::seconds(20));
  }
};

TEST_F(DaemonWatchingTest, AWatcherSeesWhatHappensOnDisk) {
  write("stays");
  write("goes");
  upSignedIn();
  const auto subscribed = subscribe();
  ASSERT_EQ(watch(subscribed, root_), nullptr);
  for (const auto& item : page({}, 0, 100).items) subscribed.watcher->add(item);
  EXPECT_TRUE(subscribed.watcher->waitForNames({"stays", "goes"}));
  write("comes");
  fs::remove(root_ + "/goes");
  EXPECT_TRUE(subscribed.watcher->waitForNames({"stays", "comes"}));
  const auto identifier = subscribed.watcher->identifierOf("comes");
  fs::rename(root_ + "/comes", root_ + "/renamed");
  EXPECT_TRUE(subscribed.watcher->waitForNames({"stays", "renamed"}));
  EXPECT_EQ(subscribed.watcher->identifierOf("renamed"), identifier);
}

TEST_F(DaemonWatchingTest, AMoveBetweenWatchedFoldersKeepsTheIdentity) {
  write("from/x");
  write("to/y");
  upSignedIn();
  const auto from = subscribe();
  const auto to = subscribe();
  ASSERT_EQ(watch(from, root_ + "/from"), nullptr);
  ASSERT_EQ(watch(to, root_ + "/to"), nullptr);
  const auto item = itemAt(root_ + "/from/x", false);
  ASSERT_TRUE(item);
  from.watcher->add(*item);
  fs::rename(root_ + "/from/x", root_ + "/to/x");
  EXPECT_TRUE(from.watcher->waitForNames({}));
  EXPECT_TRUE(to.watcher->waitForNames({"x"}));
  EXPECT_EQ(to.watcher->identifierOf("x"), item->identifier);
  EXPECT_EQ(locationOf(item->identifier), root_ + "/to/x");
}

TEST_F(DaemonWatchingTest, ARecursiveWatcherHoldsWhatIsOnDisk) {
  upSignedIn();
  const auto subscribed = subscribe();
  ASSERT_EQ(watch(subscribed, root_, 23), nullptr);
  EXPECT_THAT(list(), ElementsAre());  // what the first scan finds is listed, not told
  std::set<std::string> expected;
  for (int i = 0; i < 20; ++i) {
    const std::string folder = "folder" + std::to_string(i);
    write(folder + "/deep/file" + std::to_string(i));
    if (i % 3 == 0) {
      fs::remove_all(root_ + "/" + folder);
      continue;
    }
    expected.insert({folder, "deep", "file" + std::to_string(i)});
  }
  EXPECT_TRUE(subscribed.watcher->waitForNames(expected));
}

TEST_F(DaemonWatchingTest, OnlyFoldersThatExistCanBeWatched) {
  write("file");
  upSignedIn();
  const auto subscribed = subscribe();
  EXPECT_TRUE(watch(subscribed, root_ + "/nothing")->is(NSCocoaErrorDomain, NSFileNoSuchFileError));
  EXPECT_TRUE(watch(subscribed, root_ + "/file")->is(NSPOSIXErrorDomain, ENOTDIR));
  EXPECT_TRUE(
      watch(subscribed, root_, 0)->is(QSOstrellErrorDomain, QSOstrellErrorInvalidParameter));
  fs::create_directory(root_ + "/just-made");
  EXPECT_EQ(watch(subscribed, root_ + "/just-made"), nullptr);
}

TEST_F(DaemonWatchingTest, DroppingTheSenderEndsItsWatch) {
  upSignedIn();
  auto subscribed = subscribe();
  ASSERT_EQ(watch(subscribed, root_), nullptr);
  EXPECT_EQ(drive_->watchers->count(), 1U);
  subscribed.sender = nullptr;
  const auto deadline = steady_clock::now() + std::chrono::seconds(10);
  while (drive_->watchers->count() != 0 && steady_clock::now() < deadline) {
    call(&Wire::Client::describeRequest, [](auto) {}, [](auto) {});
  }
  EXPECT_EQ(drive_->watchers->count(), 0U);
}

TEST_F(DaemonWatchingTest, AWatchIsActiveBeforeAnyLaterCallOfItsConnectionAndBringsNoItems) {
  using protocol::ItemSender;
  write("folder/there");
  upSignedIn();
  EXPECT_THAT(list(), ElementsAre("folder"));  // over an empty database calls wait for the scan
  constexpr int kRounds = 50;
  std::vector<Subscribed> subscribed;
  Gate watched;
  for (int round = 1; round <= kRounds; ++round) {
    subscribed.push_back(subscribe());
    // Its answer is not waited for.
    (void)ipc::call(
        subscribed.back().sender, &ItemSender::Client::watchItemRequest,
        [&](ItemSender::WatchItemParams::Builder params) {
          params.setPath(wireData(root_ + "/folder"));
          params.setOptions(19);
        },
        [&](const NSErrorRef& error, const ItemSender::WatchItemResults::Reader*) {
          EXPECT_EQ(error, nullptr);
          watched.open();
        });
    std::size_t active = 0;
    call(
        &Wire::Client::describeRequest, [](auto) {},
        [&](auto) { active = drive_->watchers->count(); });
    EXPECT_EQ(active, static_cast<std::size_t>(round));
    if (round == kRounds / 2) {
      EXPECT_TRUE(waitForUploads());
    }
  }
  EXPECT_TRUE(watched.wait(kRounds));
  write("folder/new");
  for (const auto& each : subscribed) ASSERT_TRUE(each.watcher->waitForNames({"new"}));
}

TEST_F(DaemonWatchingTest, AWatchThatBeganBeforeADocumentWasUploadedIsToldOfThatAndMissesNothing) {
  write("folder/there");
  upSignedIn();
  EXPECT_THAT(list(), ElementsAre("folder"));
  const auto early = subscribe();
  ASSERT_EQ(watch(early, root_ + "/folder"), nullptr);
  ASSERT_TRUE(waitUntil([&] { return drive_->engine->transfers().isOffline; }));
  EXPECT_TRUE(early.watcher->waitForNames({}));
  reachStore();
  EXPECT_TRUE(early.watcher->waitForNames({"there"}));
  const auto late = subscribe();
  ASSERT_EQ(watch(late, root_ + "/folder"), nullptr);
  write("folder/new");
  EXPECT_TRUE(early.watcher->waitForNames({"there", "new"}));
  EXPECT_TRUE(late.watcher->waitForNames({"new"}));
}

TEST_F(DaemonWatchingTest, WithoutEnoughWatchesItSaysWhatToRaiseAndStillSeesChanges) {
  write("a/x");
  write("b/x");
  Drive::Options options;
  options.observer.watchLimit = 2;
  options.observer.unwatchedInterval = std::chrono::milliseconds(10);
  options.observer.unwatchedCostFactor = 1;
  upSignedIn(options);
  const auto a = subscribe();
  const auto b = subscribe();
  ASSERT_EQ(watch(a, root_ + "/a"), nullptr);
  ASSERT_EQ(watch(b, root_ + "/b"), nullptr);
  write("a/new");
  write("b/new");
  EXPECT_TRUE(a.watcher->waitForNames({"new"}));
  EXPECT_TRUE(b.watcher->waitForNames({"new"}));
  call(
      &Wire::Client::statusRequest, [](auto) {},
      [](auto results) {
        EXPECT_EQ(results.getStatus().getObservation(), Wire::Status::Observation::SCANNING);
        EXPECT_THAT(stringFromWire(results.getStatus().getObservationAdvice()),
                    testing::HasSubstr("--watch-limit"));
      });
}

}  // namespace
}  // namespace yomber::test
