#pragma once

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <system_error>
#include <vector>

#include "platform/fileprovider/item_codec.h"
#include "platform/foundation/fault_points.h"
#include "platform/foundation/lock.h"
#include "platform/ipc/call.h"
#include "platform/ipc/connection.h"
#include "platform/ipc/error_codec.h"
#include "platform/ipc/listener.h"
#include "zarn/daemon_server.h"
#include "zarn/drive.h"

namespace yomber::test {

namespace fs = std::filesystem;
using Wire = protocol::Daemon;
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
  /// A failure says what is held instead.
  testing::AssertionResult waitForNames(const std::set<std::string>& expected) {
    std::set<std::string> held;
    const bool isHeld = waitUntil([&](const auto& names) {
      held.clear();
      for (const auto& [identifier, name] : names) held.insert(name);
      return held == expected;
    });
    if (isHeld) return testing::AssertionSuccess();
    return testing::AssertionFailure() << "it holds " << testing::PrintToString(held) << " and not "
                                       << testing::PrintToString(expected);
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
  /// From a listing: what was told meanwhile is newer.
  void add(const ItemFields& item) {
    LockGuard guard(mutex_);
    if (!told_.contains(item.identifier)) names_[item.identifier] = item.filename;
  }

 private:
  void take(capnp::List<protocol::Item>::Reader items) {
    LockGuard guard(mutex_);
    for (const auto item : items) {
      const ItemFields fields = decodeItem(item);
      told_.insert(fields.identifier);
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
  std::set<std::string> told_ GUARDED_BY(mutex_);
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

/// A daemon on a temporary home, and a client of it over its socket.
class DaemonTest : public testing::Test {
 protected:
  DaemonTest() {
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
  ~DaemonTest() override {
    FaultPoint::disarmAll();
    down();
    std::error_code ignored;  // the database's own files go when it is closed
    fs::remove_all(base_, ignored);
  }

  void up(Drive::Options options = {}) {
    options.applications = {base_ + "/applications"};
    options.content.uploadPause = std::chrono::milliseconds::zero();
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
    ipc::EventLoop::shared().runAndWait([] {});  // its destructor has run there
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
    call(
        &Wire::Client::signInRequest, [&](auto params) { params.setName(wireText(name)); },
        [&](auto results) { failure = ipc::decodeOptional(results.getFailure()); });
    return failure;
  }
  NSErrorRef signOut() {
    NSErrorRef failure;
    call(
        &Wire::Client::signOutRequest, [](auto) {},
        [&](auto results) { failure = ipc::decodeOptional(results.getFailure()); });
    return failure;
  }
  std::optional<ItemFields> itemAt(const std::string& path, bool scan,
                                   NSErrorRef* error = nullptr) {
    std::optional<ItemFields> item;
    call(
        &Wire::Client::itemAtLocationRequest,
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
    call(
        &Wire::Client::urlForItemIdentifierRequest,
        [&](auto params) { params.setIdentifier(wireText(identifier)); },
        [&](auto results) {
          const auto result = results.getResult();
          if (result.isPath()) path = stringFromWire(result.getPath());
          if (result.isError()) storeError(error, ipc::decodeError(result.getError()));
        });
    return path;
  }
  std::string documentLocation(Wire::ObjectKind kind, std::uint64_t id,
                               NSErrorRef* error = nullptr) {
    std::string path;
    call(
        &Wire::Client::documentLocationRequest,
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
    call(
        &Wire::Client::enumerateItemsInFolderRequest,
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
    call(
        &Wire::Client::getItemUpdateSenderRequest,
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

}  // namespace yomber::test
