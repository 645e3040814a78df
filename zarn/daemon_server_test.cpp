#include "zarn/daemon_server.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include "platform/fileprovider/constants.h"
#include "platform/ostrell/constants.h"
#include "zarn/test_daemon.h"

namespace yomber::test {
namespace {

using testing::ElementsAre;

class DaemonServerTest : public DaemonTest {};

TEST_F(DaemonServerTest, DescribesItself) {
  up();
  call(
      &Wire::Client::describeRequest, [](auto) {},
      [&](auto results) {
        EXPECT_EQ(stringFromWire(results.getHome()), paths_.home);
        EXPECT_EQ(stringFromWire(results.getRoot()), root_);
        EXPECT_EQ(stringFromWire(results.getProgram()), "zarn");
        EXPECT_EQ(results.getPid(), static_cast<std::uint32_t>(getpid()));
      });
}

TEST_F(DaemonServerTest, ListsWhatWasThereBeforeItStarted) {
  for (int i = 0; i < 450; ++i) write("f" + std::to_string(i));
  write("folder/inside");
  upSignedIn();
  const auto names = list();
  ASSERT_EQ(names.size(), 451U);
  EXPECT_EQ(names[0], "f0");
  EXPECT_EQ(names[10], "f10");  // numbers by value
  EXPECT_EQ(names[450], "folder");
  const auto folder = itemAt(root_ + "/folder", false);
  ASSERT_TRUE(folder);
  EXPECT_THAT(list(folder->rawID), ElementsAre("inside"));
}

TEST_F(DaemonServerTest, AListingWaitsForTheFirstScan) {
  write("x");
  ASSERT_EQ(FaultPoint::arm("zarn.drive.before-scan=pause-until-file:" + base_ + "/go"), nullptr);
  up();
  ASSERT_EQ(signIn("ada"), nullptr);
  call(
      &Wire::Client::statusRequest, [](auto) {},
      [](auto results) { EXPECT_EQ(results.getStatus().getScan(), Wire::Status::Scan::RUNNING); });
  ipc::Gate answered;
  Page first;
  (void)ipc::call(
      daemon_, &Wire::Client::enumerateItemsInFolderRequest,
      [](auto params) { params.setLimit(10); },
      [&](const NSErrorRef& error, const auto* results) {
        if (error == nullptr) first = decodePage(*results);
        answered.open();
      });
  std::ofstream(base_ + "/go").put('x');
  answered.wait();
  EXPECT_EQ(first.items.size(), 1U);
}

TEST_F(DaemonServerTest, FindsItemsBothWays) {
  write("a/b/c.txt", "hello");
  upSignedIn();
  const auto item = itemAt(root_ + "/a/b/c.txt", true);
  ASSERT_TRUE(item);
  EXPECT_EQ(item->filename, "c.txt");
  EXPECT_EQ(item->size, 5U);
  EXPECT_EQ(item->contentType, "text/plain");
  EXPECT_EQ(item->identifier, "d:" + std::to_string(item->rawID));
  EXPECT_EQ(locationOf(item->identifier), root_ + "/a/b/c.txt");
  EXPECT_EQ(documentLocation(Wire::ObjectKind::DOCUMENT, item->rawID), root_ + "/a/b/c.txt");
  EXPECT_EQ(locationOf(NSFileProviderRootContainerItemIdentifier), root_);
  const auto root = itemAt(root_, false);
  ASSERT_TRUE(root);
  EXPECT_EQ(root->identifier, NSFileProviderRootContainerItemIdentifier);
}

TEST_F(DaemonServerTest, WhatIsNotThereIsSaidToBeMissing) {
  write("x");
  upSignedIn();
  const auto item = itemAt(root_ + "/x", true);
  ASSERT_TRUE(item);
  const auto expectMissing = [](const NSErrorRef& error) {
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSFileNoSuchFileError)) << error->description();
  };
  for (const bool scan : {false, true}) {
    for (const std::string& path :
         {root_ + "/nothing", root_ + "/x/below", std::string("/etc"), std::string("x"),
          std::string(), root_ + "/../x", drive_->layout.promises()}) {
      NSErrorRef error;
      EXPECT_FALSE(itemAt(path, scan, &error)) << path;
      expectMissing(error);
    }
  }
  for (const std::string& identifier :
       {std::string("i:") + std::to_string(item->rawID), std::string("d:5"), std::string("d:99999"),
        std::string(), std::string(100'000, 'd')}) {
    NSErrorRef error;
    EXPECT_EQ(locationOf(identifier, &error), "");
    expectMissing(error);
  }
  for (const std::uint64_t id : {std::uint64_t{0}, std::uint64_t{1}, ~std::uint64_t{0}}) {
    NSErrorRef error;
    EXPECT_EQ(documentLocation(Wire::ObjectKind::FOLDER, id, &error), "");
    expectMissing(error);
  }
  NSErrorRef error;
  EXPECT_EQ(documentLocation(Wire::ObjectKind::FOLDER, item->rawID, &error), "");
  expectMissing(error);
}

TEST_F(DaemonServerTest, AForcedScanSeesWhatWasJustMade) {
  upSignedIn();
  for (int i = 0; i < 50; ++i) {
    const std::string name = "new" + std::to_string(i);
    write(name);
    const auto item = itemAt(root_ + "/" + name, true);
    ASSERT_TRUE(item) << name;
    EXPECT_EQ(item->filename, name);
  }
}

TEST_F(DaemonServerTest, ALookupFindsWhatTheObserverHasNotComeToYet) {
  write("known");
  Drive::Options options;
  options.observer.batchInterval = std::chrono::hours(1);  // it is busy with others
  upSignedIn(options);
  ASSERT_TRUE(itemAt(root_ + "/known", false));
  write("made/a moment ago");
  write("left alone.nosync");
  ASSERT_EQ(mkfifo((root_ + "/pipe").c_str(), 0600), 0);

  const auto item = itemAt(root_ + "/made/a moment ago", false);
  ASSERT_TRUE(item);
  EXPECT_EQ(locationOf(item->identifier), root_ + "/made/a moment ago");
  for (const char* name : {"left alone.nosync", "pipe", "never made"}) {
    NSErrorRef error;
    EXPECT_FALSE(itemAt(root_ + "/" + name, false, &error)) << name;
    ASSERT_TRUE(error) << name;
    EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSFileNoSuchFileError)) << error->description();
  }
}

TEST_F(DaemonServerTest, RefusesLimitsThatAreTooLargeOrZero) {
  upSignedIn();
  EXPECT_TRUE(page({}, 0, 1001).error->is(QSOstrellErrorDomain, QSOstrellErrorInvalidParameter));
  EXPECT_TRUE(page({}, 0, 0).error->is(QSOstrellErrorDomain, QSOstrellErrorInvalidParameter));
  EXPECT_EQ(page({}, 0, 1000).error, nullptr);
  EXPECT_TRUE(page(kTrashID, 0, 10).error);
}

TEST_F(DaemonServerTest, ListsAllFolders) {
  write("a/b/x");
  write("c/x");
  upSignedIn();
  std::vector<std::string> names;
  call(
      &Wire::Client::enumerateAllFoldersRequest, [](auto params) { params.setLimit(10); },
      [&](auto results) {
        for (const auto& item : decodePage(results).items) names.push_back(item.filename);
      });
  EXPECT_THAT(names, ElementsAre("a", "b", "c"));
}

TEST_F(DaemonServerTest, NobodySignedInIsSaidByEveryCallThatIsBoundToTheAccount) {
  write("x");
  up();
  const auto expectLoggedOut = [](const NSErrorRef& error) {
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(QSOstrellErrorDomain, QSOstrellErrorLoggedOut)) << error->description();
  };
  NSErrorRef error;
  EXPECT_FALSE(itemAt(root_ + "/x", true, &error));
  expectLoggedOut(error);
  expectLoggedOut(page({}, 0, 10).error);
  expectLoggedOut(subscribe().error);
  call(
      &Wire::Client::currentNotifRankRequest, [](auto) {},
      [&](auto results) { expectLoggedOut(ipc::decodeOptional(results.getFailure())); });
  call(
      &Wire::Client::enumerateWorkingSetChangesRequest, [](auto params) { params.setLimit(1); },
      [&](auto results) {
        ASSERT_TRUE(results.getResult().isError());
        expectLoggedOut(ipc::decodeError(results.getResult().getError()));
      });
  call(
      &Wire::Client::accountRequest, [](auto) {},
      [](auto results) { EXPECT_TRUE(results.getResult().isNone()); });
}

TEST_F(DaemonServerTest, SigningOutEndsWatchesAndTellsObservers) {
  up();
  const auto notified = std::make_shared<Notified>();
  ipc::Remote<protocol::Registration> registration;
  call(
      &Wire::Client::observeRequest,
      [&](auto params) { params.setObserver(kj::heap<Notified::Observer>(notified)); },
      [&](auto results) {
        registration = ipc::Remote<protocol::Registration>(results.getRegistration());
      });
  ASSERT_EQ(signIn("ada"), nullptr);
  EXPECT_TRUE(notified->waitFor("account"));
  const auto subscribed = subscribe();
  ASSERT_EQ(watch(subscribed, root_), nullptr);
  ASSERT_EQ(signOut(), nullptr);
  const auto failure = subscribed.watcher->waitForFailure();
  ASSERT_TRUE(failure);
  EXPECT_TRUE(failure->is(QSOstrellErrorDomain, QSOstrellErrorLoggedOut));
  EXPECT_TRUE(notified->waitFor("account", 2));
  EXPECT_TRUE(watch(subscribed, root_)->is(QSOstrellErrorDomain, QSOstrellErrorLoggedOut));
}

TEST_F(DaemonServerTest, ContainersOfInstalledApplicationsShowInTheRoot) {
  upSignedIn();
  const auto notified = std::make_shared<Notified>();
  ipc::Remote<protocol::Registration> registration;
  call(
      &Wire::Client::observeRequest,
      [&](auto params) { params.setObserver(kj::heap<Notified::Observer>(notified)); },
      [&](auto results) {
        registration = ipc::Remote<protocol::Registration>(results.getRegistration());
      });
  EXPECT_THAT(list(), ElementsAre());
  std::ofstream(base_ + "/applications/notes.desktop")
      << "[Desktop Entry]\nName=Notes\nX-Yomber-Container=org.example.notes\n";
  ASSERT_TRUE(notified->waitFor("containers"));
  EXPECT_THAT(list(), ElementsAre("Notes"));
  const std::string documents = drive_->layout.documents("org.example.notes");
  std::ofstream(documents + "/page") << "x";
  const auto item = itemAt(documents + "/page", true);
  ASSERT_TRUE(item);
  EXPECT_EQ(locationOf(item->identifier), documents + "/page");
  call(
      &Wire::Client::containerItemRequest,
      [](auto params) { params.setContainerID("org.example.notes"); },
      [&](auto results) {
        ASSERT_TRUE(results.getResult().isItem());
        EXPECT_EQ(decodeItem(results.getResult().getItem()).containerID, "org.example.notes");
      });
  call(
      &Wire::Client::containersRequest, [](auto) {},
      [&](auto results) {
        ASSERT_EQ(results.getContainers().size(), 4U);
        EXPECT_EQ(stringFromWire(results.getContainers()[3].getDocuments()), documents);
      });
}

TEST_F(DaemonServerTest, TagsBringAnItemIntoTheWorkingSetAndSignalTheHost) {
  write("x");
  upSignedIn();
  ASSERT_TRUE(itemAt(root_ + "/x", true));
  const auto notified = std::make_shared<Notified>();
  ipc::Remote<protocol::Registration> registration;
  call(
      &Wire::Client::registerHostRequest,
      [&](auto params) { params.setHost(kj::heap<Notified::Host>(notified)); },
      [&](auto results) {
        registration = ipc::Remote<protocol::Registration>(results.getRegistration());
      });
  ASSERT_EQ(std::system(("setfattr -n user.xdg.tags -v red " + root_ + "/x").c_str()), 0);
  EXPECT_TRUE(notified->waitFor(NSFileProviderWorkingSetContainerItemIdentifier));
  std::string token;
  call(
      &Wire::Client::enumerateWorkingSetChangesRequest, [](auto params) { params.setLimit(10); },
      [&](auto results) {
        ASSERT_TRUE(results.getResult().isChanges());
        const auto changes = results.getResult().getChanges();
        ASSERT_EQ(changes.getUpdated().size(), 1U);
        EXPECT_THAT(decodeItem(changes.getUpdated()[0]).tags, ElementsAre("red"));
        token = stringFromWire(changes.getToken());
      });
  call(
      &Wire::Client::enumerateWorkingSetChangesRequest,
      [&](auto params) {
        params.initToken().setValue(wireData("no token"));
        params.setLimit(10);
      },
      [](auto results) {
        ASSERT_TRUE(results.getResult().isError());
        EXPECT_TRUE(ipc::decodeError(results.getResult().getError())
                        ->is(NSFileProviderErrorDomain, NSFileProviderErrorSyncAnchorExpired));
      });
}

TEST_F(DaemonServerTest, AfterARestartIdentitiesAreTheSameAndChangesMadeMeanwhileShow) {
  write("stays");
  write("goes");
  write("folder/x");
  upSignedIn();
  const auto before = itemAt(root_ + "/stays", true);
  const auto inside = itemAt(root_ + "/folder/x", true);
  ASSERT_TRUE(before && inside);
  down();
  fs::rename(root_ + "/stays", root_ + "/renamed");
  fs::remove(root_ + "/goes");
  write("new");
  up();
  EXPECT_EQ(signIn("ada"), nullptr);
  const auto subscribed = subscribe();
  ASSERT_EQ(watch(subscribed, root_), nullptr);
  for (const auto& item : page({}, 0, 100).items) subscribed.watcher->add(item);
  EXPECT_TRUE(subscribed.watcher->waitForNames({"renamed", "new", "folder"}));
  EXPECT_EQ(locationOf(before->identifier), root_ + "/renamed");
  EXPECT_EQ(locationOf(inside->identifier), root_ + "/folder/x");
}

TEST_F(DaemonServerTest, StatusCountsWhatThereIs) {
  write("a/x");
  write("y");
  upSignedIn();
  (void)list();
  const auto deadline = steady_clock::now() + std::chrono::seconds(10);
  bool isDone = false;
  while (!isDone && steady_clock::now() < deadline) {
    call(
        &Wire::Client::statusRequest, [](auto) {},
        [&](auto results) {
          const auto status = results.getStatus();
          isDone = status.getScan() == Wire::Status::Scan::DONE;
          EXPECT_EQ(status.getItems(), 3U);
          EXPECT_EQ(status.getFolders(), 1U);
          EXPECT_GT(status.getResidentBytes(), 1'000'000U);
          EXPECT_GT(status.getOpenDescriptors(), 3U);
          EXPECT_EQ(status.getObservation(), Wire::Status::Observation::LIVE);
        });
  }
  EXPECT_TRUE(isDone);
}

TEST_F(DaemonServerTest, AFailedFirstScanIsToldAndTriedAgain) {
  write("x");
  ASSERT_EQ(FaultPoint::arm("zarn.drive.before-scan=error"), nullptr);
  Drive::Options options;
  options.observer.retryInterval = std::chrono::milliseconds(20);
  up(options);
  ASSERT_EQ(signIn("ada"), nullptr);
  const auto failed = page({}, 0, 10);
  ASSERT_TRUE(failed.error);
  EXPECT_TRUE(failed.error->is(NSPOSIXErrorDomain, EIO)) << failed.error->description();
  FaultPoint::disarmAll();
  const auto deadline = steady_clock::now() + std::chrono::seconds(10);
  while (page({}, 0, 10).error && steady_clock::now() < deadline) {
  }
  EXPECT_EQ(list(), std::vector<std::string>{"x"});
}

}  // namespace
}  // namespace yomber::test
