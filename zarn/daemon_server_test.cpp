#include "zarn/daemon_server.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <set>

#include "platform/fileprovider/constants.h"
#include "platform/fileprovider/item_codec.h"
#include "platform/foundation/fault_points.h"
#include "platform/foundation/lock.h"
#include "platform/ipc/call.h"
#include "platform/ipc/connection.h"
#include "platform/ipc/error_codec.h"
#include "platform/ipc/listener.h"
#include "platform/ostrell/constants.h"

namespace yomber {
namespace {

using testing::ElementsAre;
using testing::UnorderedElementsAre;
using Wire = protocol::Daemon;
namespace fs = std::filesystem;
using std::chrono::steady_clock;

/// What a watcher holds: names by identifier, as it was told.
class Watcher {
 public:
  class Server final : public protocol::ItemReceiver::Server {
   public:
    explicit Server(std::shared_ptr<Watcher> watcher) : watcher_(std::move(watcher)) {}
    kj::Promise<void> receiveUpdates(ReceiveUpdatesContext context) override {
      watcher_->take(context.getParams().getItems());
      return kj::READY_NOW;
    }
    kj::Promise<void> senderDidFail(SenderDidFailContext context) override {
      watcher_->fail(ipc::decodeError(context.getParams().getError()));
      return kj::READY_NOW;
    }

   private:
    const std::shared_ptr<Watcher> watcher_;
  };

  bool waitUntil(const std::function<bool(const std::map<std::string, std::string>&)>& condition) {
    const auto deadline = steady_clock::now() + std::chrono::seconds(20);
    LockGuard guard(mutex_);
    while (!condition(names_)) {
      if (!changed_.waitUntil(mutex_, deadline)) return false;
    }
    return true;
  }
  bool waitForNames(const std::set<std::string>& expected) {
    return waitUntil([&](const auto& names) {
      std::set<std::string> values;
      for (const auto& [identifier, name] : names) values.insert(name);
      return values == expected;
    });
  }
  NSErrorRef waitForFailure() {
    const auto deadline = steady_clock::now() + std::chrono::seconds(20);
    LockGuard guard(mutex_);
    while (!failure_ && changed_.waitUntil(mutex_, deadline)) {
    }
    return failure_;
  }
  std::string identifierOf(const std::string& name) {
    LockGuard guard(mutex_);
    for (const auto& [identifier, each] : names_) {
      if (each == name) return identifier;
    }
    return {};
  }
  void add(const ItemFields& item) {
    LockGuard guard(mutex_);
    names_[item.identifier] = item.filename;
  }

 private:
  void take(capnp::List<protocol::Item>::Reader items) {
    LockGuard guard(mutex_);
    for (const auto item : items) {
      const ItemFields fields = decodeItem(item);
      if ((fields.flags & row_flag::kDead) != 0) {
        names_.erase(fields.identifier);
      } else {
        names_[fields.identifier] = fields.filename;
      }
    }
    changed_.notifyAll();
  }
  void fail(NSErrorRef error) {
    LockGuard guard(mutex_);
    failure_ = std::move(error);
    changed_.notifyAll();
  }

  Mutex mutex_;
  Condition changed_;
  std::map<std::string, std::string> names_ GUARDED_BY(mutex_);
  NSErrorRef failure_ GUARDED_BY(mutex_);
};

/// Counts the notifications of an observer or host.
class Notified {
 public:
  void note(const std::string& what) {
    LockGuard guard(mutex_);
    ++counts_[what];
    changed_.notifyAll();
  }
  bool waitFor(const std::string& what, int count = 1) {
    const auto deadline = steady_clock::now() + std::chrono::seconds(20);
    LockGuard guard(mutex_);
    while (counts_[what] < count) {
      if (!changed_.waitUntil(mutex_, deadline)) return false;
    }
    return true;
  }

  class Observer final : public protocol::LibraryObserver::Server {
   public:
    explicit Observer(std::shared_ptr<Notified> notified) : notified_(std::move(notified)) {}
    kj::Promise<void> accountTokenDidChange(AccountTokenDidChangeContext) override {
      notified_->note("account");
      return kj::READY_NOW;
    }
    kj::Promise<void> containerListDidChange(ContainerListDidChangeContext) override {
      notified_->note("containers");
      return kj::READY_NOW;
    }

   private:
    const std::shared_ptr<Notified> notified_;
  };
  class Host final : public protocol::HostReceiver::Server {
   public:
    explicit Host(std::shared_ptr<Notified> notified) : notified_(std::move(notified)) {}
    kj::Promise<void> signalEnumerator(SignalEnumeratorContext context) override {
      notified_->note(stringFromWire(context.getParams().getContainer()));
      return kj::READY_NOW;
    }

   private:
    const std::shared_ptr<Notified> notified_;
  };

 private:
  Mutex mutex_;
  Condition changed_;
  std::map<std::string, int> counts_ GUARDED_BY(mutex_);
};

class DaemonServerTest : public testing::Test {
 protected:
  DaemonServerTest() {
    char directory[] = "/tmp/yomber-daemon-XXXXXX";
    base_ = mkdtemp(directory);
    setenv("XDG_RUNTIME_DIR", (base_ + "/run").c_str(), 1);
    fs::create_directory(base_ + "/run");
    fs::permissions(base_ + "/run", fs::perms::owner_all);
    fs::create_directory(base_ + "/applications");
    paths_ = DrivePaths::forHome(base_ + "/home");
    EXPECT_EQ(paths_.create(), nullptr);
    EXPECT_EQ(TreeLayout(paths_.home).createFolders(), 0);
    root_ = TreeLayout(paths_.home).root();
  }
  ~DaemonServerTest() override {
    FaultPoint::disarmAll();
    down();
    fs::remove_all(base_);
  }

  void up(Drive::Options options = {}) {
    options.applications = {base_ + "/applications"};
    NSErrorRef error;
    drive_ = Drive::open(paths_, options, &error);
    ASSERT_TRUE(drive_) << error->description();
    listener_ = ipc::Listener::listen(
        paths_.daemonSocket,
        [drive = drive_](const ipc::PeerCredentials&) -> capnp::Capability::Client {
          return kj::heap<DaemonServer>(drive);
        },
        &error);
    ASSERT_TRUE(listener_) << error->description();
    drive_->start();
    connection_ = ipc::Connection::connect(paths_.daemonSocket, &error);
    ASSERT_TRUE(connection_) << error->description();
    daemon_ = connection_->bootstrap<Wire>();
  }
  void upSignedIn(Drive::Options options = {}) {
    up(options);
    ASSERT_EQ(signIn("ada"), nullptr);
  }
  void down() {
    daemon_ = nullptr;
    connection_.reset();
    listener_.reset();
    // What the connection left on the loop thread holds the drive too.
    const std::weak_ptr<Drive> ending = drive_;
    if (drive_) drive_->stop();
    drive_.reset();
    while (!ending.expired()) ipc::EventLoop::shared().runAndWait([] {});
  }
  void write(const std::string& name, const std::string& text = "x") {
    fs::create_directories(fs::path(root_ + "/" + name).parent_path());
    std::ofstream(root_ + "/" + name) << text;
  }

  // --- Calls. Answer what the daemon said; a transport failure fails the test.

  template <typename Method, typename Fill, typename Decode>
  void call(Method method, Fill fill, Decode decode) {
    const auto error = ipc::callAndWait(daemon_, method, fill, decode);
    ASSERT_EQ(error, nullptr) << error->description();
  }
  NSErrorRef signIn(const std::string& name) {
    NSErrorRef failure;
    call(&Wire::Client::signInRequest, [&](auto params) { params.setName(wireText(name)); },
         [&](auto results) { failure = ipc::decodeOptional(results.getFailure()); });
    return failure;
  }
  NSErrorRef signOut() {
    NSErrorRef failure;
    call(&Wire::Client::signOutRequest, [](auto) {},
         [&](auto results) { failure = ipc::decodeOptional(results.getFailure()); });
    return failure;
  }
  std::optional<ItemFields> itemAt(const std::string& path, bool scan, NSErrorRef* error = nullptr) {
    std::optional<ItemFields> item;
    call(&Wire::Client::itemAtLocationRequest,
         [&](auto params) {
           params.setPath(wireData(path));
           params.setFakeFSEvent(scan);
         },
         [&](auto results) {
           const auto result = results.getResult();
           if (result.isItem()) item = decodeItem(result.getItem());
           if (result.isError()) storeError(error, ipc::decodeError(result.getError()));
         });
    return item;
  }
  std::string locationOf(const std::string& identifier, NSErrorRef* error = nullptr) {
    std::string path;
    call(&Wire::Client::urlForItemIdentifierRequest,
         [&](auto params) { params.setIdentifier(wireText(identifier)); },
         [&](auto results) {
           const auto result = results.getResult();
           if (result.isPath()) path = stringFromWire(result.getPath());
           if (result.isError()) storeError(error, ipc::decodeError(result.getError()));
         });
    return path;
  }
  std::string documentLocation(Wire::ObjectKind kind, std::uint64_t id, NSErrorRef* error = nullptr) {
    std::string path;
    call(&Wire::Client::documentLocationRequest,
         [&](auto params) {
           params.initObject().setKind(kind);
           params.getObject().setRawID(id);
         },
         [&](auto results) {
           const auto result = results.getResult();
           if (result.isPath()) path = stringFromWire(result.getPath());
           if (result.isError()) storeError(error, ipc::decodeError(result.getError()));
         });
    return path;
  }

  struct Page {
    std::vector<ItemFields> items;
    std::uint64_t nextOffset = 0;
    NSErrorRef error;
  };
  template <typename Results>
  static Page decodePage(Results results) {
    Page page;
    const auto result = results.getResult();
    if (result.isError()) {
      page.error = ipc::decodeError(result.getError());
      return page;
    }
    for (const auto item : result.getPage().getItems()) page.items.push_back(decodeItem(item));
    page.nextOffset = result.getPage().getNextOffset();
    return page;
  }
  Page page(std::optional<std::uint64_t> folder, std::uint64_t offset, std::uint32_t limit) {
    Page page;
    call(&Wire::Client::enumerateItemsInFolderRequest,
         [&](auto params) {
           if (folder) {
             params.initFolder().initObject().setRawID(*folder);
             params.getFolder().getObject().setKind(Wire::ObjectKind::FOLDER);
           }
           params.setOffset(offset);
           params.setLimit(limit);
         },
         [&](auto results) { page = decodePage(results); });
    return page;
  }
  std::vector<std::string> list(std::optional<std::uint64_t> folder = {}) {
    std::vector<std::string> names;
    std::uint64_t offset = 0;
    do {
      const Page next = page(folder, offset, 200);
      EXPECT_EQ(next.error, nullptr) << next.error->description();
      for (const auto& item : next.items) names.push_back(item.filename);
      offset = next.nextOffset;
    } while (offset != 0);
    return names;
  }

  struct Subscribed {
    std::shared_ptr<Watcher> watcher = std::make_shared<Watcher>();
    ipc::Remote<protocol::ItemSender> sender;
    NSErrorRef error;
  };
  Subscribed subscribe() {
    Subscribed made;
    call(&Wire::Client::getItemUpdateSenderRequest,
         [&](auto params) { params.setReceiver(kj::heap<Watcher::Server>(made.watcher)); },
         [&](auto results) {
           const auto result = results.getResult();
           if (result.isError()) {
             made.error = ipc::decodeError(result.getError());
           } else {
             made.sender = ipc::Remote<protocol::ItemSender>(result.getSender());
           }
         });
    return made;
  }
  NSErrorRef watch(const Subscribed& subscribed, const std::string& path,
                   std::uint32_t options = 19) {
    NSErrorRef failure;
    const auto error = ipc::callAndWait(
        subscribed.sender, &protocol::ItemSender::Client::watchItemRequest,
        [&](auto params) {
          params.setPath(wireData(path));
          params.setOptions(options);
        },
        [&](auto results) { failure = ipc::decodeOptional(results.getFailure()); });
    EXPECT_EQ(error, nullptr) << error->description();
    return failure;
  }

  std::string base_;
  std::string root_;
  DrivePaths paths_;
  std::shared_ptr<Drive> drive_;
  std::unique_ptr<ipc::Listener> listener_;
  ipc::Connection::Ref connection_;
  ipc::Remote<Wire> daemon_;
};

TEST_F(DaemonServerTest, DescribesItself) {
  up();
  call(&Wire::Client::describeRequest, [](auto) {}, [&](auto results) {
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
  call(&Wire::Client::statusRequest, [](auto) {}, [](auto results) {
    EXPECT_EQ(results.getStatus().getScan(), Wire::Status::Scan::RUNNING);
  });
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
    for (const std::string& path : {root_ + "/nothing", root_ + "/x/below", std::string("/etc"),
                                    std::string("x"), std::string(), root_ + "/../x",
                                    drive_->layout.promises()}) {
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
  call(&Wire::Client::enumerateAllFoldersRequest, [](auto params) { params.setLimit(10); },
       [&](auto results) {
         for (const auto& item : decodePage(results).items) names.push_back(item.filename);
       });
  EXPECT_THAT(names, ElementsAre("a", "b", "c"));
}

TEST_F(DaemonServerTest, AWatcherSeesWhatHappensOnDisk) {
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

TEST_F(DaemonServerTest, AMoveBetweenWatchedFoldersKeepsTheIdentity) {
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

TEST_F(DaemonServerTest, ARecursiveWatcherHoldsWhatIsOnDisk) {
  upSignedIn();
  const auto subscribed = subscribe();
  ASSERT_EQ(watch(subscribed, root_, 23), nullptr);
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

TEST_F(DaemonServerTest, OnlyFoldersThatExistCanBeWatched) {
  write("file");
  upSignedIn();
  const auto subscribed = subscribe();
  EXPECT_TRUE(watch(subscribed, root_ + "/nothing")->is(NSCocoaErrorDomain, NSFileNoSuchFileError));
  EXPECT_TRUE(watch(subscribed, root_ + "/file")->is(NSPOSIXErrorDomain, ENOTDIR));
  EXPECT_TRUE(watch(subscribed, root_, 0)->is(QSOstrellErrorDomain, QSOstrellErrorInvalidParameter));
  fs::create_directory(root_ + "/just-made");
  EXPECT_EQ(watch(subscribed, root_ + "/just-made"), nullptr);
}

TEST_F(DaemonServerTest, DroppingTheSenderEndsItsWatch) {
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
  call(&Wire::Client::currentNotifRankRequest, [](auto) {},
       [&](auto results) { expectLoggedOut(ipc::decodeOptional(results.getFailure())); });
  call(&Wire::Client::enumerateWorkingSetChangesRequest, [](auto params) { params.setLimit(1); },
       [&](auto results) {
         ASSERT_TRUE(results.getResult().isError());
         expectLoggedOut(ipc::decodeError(results.getResult().getError()));
       });
  call(&Wire::Client::accountRequest, [](auto) {},
       [](auto results) { EXPECT_TRUE(results.getResult().isNone()); });
}

TEST_F(DaemonServerTest, SigningOutEndsWatchesAndTellsObservers) {
  up();
  const auto notified = std::make_shared<Notified>();
  ipc::Remote<protocol::Registration> registration;
  call(&Wire::Client::observeRequest,
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
  call(&Wire::Client::observeRequest,
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
  call(&Wire::Client::containerItemRequest,
       [](auto params) { params.setContainerID("org.example.notes"); },
       [&](auto results) {
         ASSERT_TRUE(results.getResult().isItem());
         EXPECT_EQ(decodeItem(results.getResult().getItem()).containerID, "org.example.notes");
       });
  call(&Wire::Client::containersRequest, [](auto) {}, [&](auto results) {
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
  call(&Wire::Client::registerHostRequest,
       [&](auto params) { params.setHost(kj::heap<Notified::Host>(notified)); },
       [&](auto results) {
         registration = ipc::Remote<protocol::Registration>(results.getRegistration());
       });
  ASSERT_EQ(std::system(("setfattr -n user.xdg.tags -v red " + root_ + "/x").c_str()), 0);
  EXPECT_TRUE(notified->waitFor(NSFileProviderWorkingSetContainerItemIdentifier));
  std::string token;
  call(&Wire::Client::enumerateWorkingSetChangesRequest, [](auto params) { params.setLimit(10); },
       [&](auto results) {
         ASSERT_TRUE(results.getResult().isChanges());
         const auto changes = results.getResult().getChanges();
         ASSERT_EQ(changes.getUpdated().size(), 1U);
         EXPECT_THAT(decodeItem(changes.getUpdated()[0]).tags, ElementsAre("red"));
         token = stringFromWire(changes.getToken());
       });
  call(&Wire::Client::enumerateWorkingSetChangesRequest,
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
    call(&Wire::Client::statusRequest, [](auto) {}, [&](auto results) {
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

TEST_F(DaemonServerTest, WithoutEnoughWatchesItSaysWhatToRaiseAndStillSeesChanges) {
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
  call(&Wire::Client::statusRequest, [](auto) {}, [](auto results) {
    EXPECT_EQ(results.getStatus().getObservation(), Wire::Status::Observation::SCANNING);
    EXPECT_THAT(stringFromWire(results.getStatus().getObservationAdvice()),
                testing::HasSubstr("--watch-limit"));
  });
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
}  // namespace yomber
