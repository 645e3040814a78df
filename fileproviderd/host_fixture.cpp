#include "fileproviderd/host_fixture.h"

#include <fcntl.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <set>
#include <stdexcept>
#include <thread>

#include "fileproviderd/control_server.h"
#include "platform/fileprovider/item_codec.h"
#include "platform/fileprovider/wire_item.h"
#include "platform/ipc/call.h"
#include "platform/ipc/error_codec.h"

namespace yomber {
namespace {

using namespace std::chrono_literals;
using protocol::Control;
using protocol::Daemon;
using protocol::Listing;

constexpr auto kPatience = 30s;

/// Ends the test at once: nothing that it says afterwards would mean anything.
void require(bool holds, const std::string& what) {
  if (!holds) throw std::runtime_error("the test cannot be set up: " + what);
}

void require(const NSErrorRef& error) {
  if (error != nullptr) require(false, error->description());
}

class Registration final : public protocol::Registration::Server {};

class WatcherServer final : public protocol::Watcher::Server {
 public:
  explicit WatcherServer(std::shared_ptr<WatchedPicture> picture) : picture_(std::move(picture)) {}

 protected:
  kj::Promise<void> didList(DidListContext context) override {
    picture_->change([&](WatchedPicture& picture) {
      take(picture, context.getParams().getItems());
      if (context.getParams().getLast()) picture.isListed = true;
    });
    return kj::READY_NOW;
  }
  kj::Promise<void> didUpdate(DidUpdateContext context) override {
    picture_->change(
        [&](WatchedPicture& picture) { take(picture, context.getParams().getItems()); });
    return kj::READY_NOW;
  }
  kj::Promise<void> didDelete(DidDeleteContext context) override {
    picture_->change([&](WatchedPicture& picture) {
      for (const auto identifier : context.getParams().getIdentifiers()) {
        picture.versions.erase(stringFromWire(identifier));
      }
    });
    return kj::READY_NOW;
  }
  kj::Promise<void> didPause(DidPauseContext) override {
    picture_->change([](WatchedPicture& picture) { ++picture.pauses; });
    return kj::READY_NOW;
  }
  kj::Promise<void> didResume(DidResumeContext) override {
    picture_->change([](WatchedPicture& picture) { ++picture.resumes; });
    return kj::READY_NOW;
  }
  kj::Promise<void> didEnd(DidEndContext context) override {
    picture_->change([&](WatchedPicture& picture) {
      picture.end = ipc::decodeError(context.getParams().getError());
    });
    return kj::READY_NOW;
  }

 private:
  static void take(WatchedPicture& picture, capnp::List<protocol::Item>::Reader items) {
    for (const auto item : items) {
      picture.versions[stringFromWire(item.getIdentifier())] = item.getVersion();
    }
  }

  const std::shared_ptr<WatchedPicture> picture_;
};

}  // namespace

bool WatchedPicture::waitFor(const std::function<bool(const WatchedPicture&)>& condition) {
  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  LockGuard guard(mutex_);
  while (!condition(*this)) {
    if (!changed_.waitUntil(mutex_, deadline)) return condition(*this);
  }
  return true;
}

void WatchedPicture::change(const std::function<void(WatchedPicture&)>& work) {
  LockGuard guard(mutex_);
  work(*this);
  changed_.notifyAll();
}

struct HostTest::Zarn {
  class Server final : public Daemon::Server {
   public:
    Server(std::string home, std::shared_ptr<std::vector<protocol::HostReceiver::Client>> hosts)
        : home_(std::move(home)), hosts_(std::move(hosts)) {}

   protected:
    kj::Promise<void> describe(DescribeContext context) override {
      context.getResults().setHome(wireData(home_));
      return kj::READY_NOW;
    }
    kj::Promise<void> registerHost(RegisterHostContext context) override {
      hosts_->push_back(context.getParams().getHost());
      context.getResults().setRegistration(kj::heap<Registration>());
      return kj::READY_NOW;
    }
    kj::Promise<void> urlForItemIdentifier(UrlForItemIdentifierContext context) override {
      const auto identifier = stringFromWire(context.getParams().getIdentifier());
      auto result = context.getResults().initResult();
      if (identifier == "gone") {
        ipc::encodeError(NSError::errorWithDomain(NSCocoaErrorDomain, NSFileNoSuchFileError),
                         result.initError());
      } else {
        result.setPath(wireData("/root/" + identifier));
      }
      return kj::READY_NOW;
    }

   private:
    const std::string home_;
    const std::shared_ptr<std::vector<protocol::HostReceiver::Client>> hosts_;
  };

  std::string home;
  /// Touched on the loop thread only.
  std::shared_ptr<std::vector<protocol::HostReceiver::Client>> hosts =
      std::make_shared<std::vector<protocol::HostReceiver::Client>>();
  std::unique_ptr<ipc::Listener> listener;
};

HostTest::HostTest() {
  // Sockets lie in the home, whatever the caller's environment says.
  unsetenv("XDG_RUNTIME_DIR");
  char pattern[] = "/tmp/yomber-host-XXXXXX";
  require(mkdtemp(pattern) != nullptr, pattern);
  home = pattern;
  paths = DrivePaths::forHome(home);
  require(paths.create());
  std::filesystem::create_directory(home + "/fake");
  require(mkfifo((home + "/fake/commands").c_str(), 0600) == 0, "no pipe for commands");
  command("root");
  setItems({{"a", 1}, {"b", 1}, {"c", 1}});
  registerItemsInErrors();
}

HostTest::~HostTest() {
  remote = nullptr;
  client.reset();
  control.reset();
  if (host) ipc::EventLoop::shared().runAndWait([&] { host.reset(); });
  stopZarn();
  std::filesystem::remove_all(home);
}

void HostTest::startHost(const std::function<void(Host::Options&)>& change) {
  ipc::EventLoop::shared().runAndWait([&] {
    Host::Options options;
    options.paths = paths;
    options.extensionProgram = YOMBER_FAKE_EXTENSION;
    if (change) change(options);
    host = Host::create(std::move(options));
    host->start();
  });
  NSErrorRef error;
  control = ipc::Listener::listen(
      paths.controlSocket,
      [weak = std::weak_ptr(host)](const ipc::PeerCredentials& peer) -> capnp::Capability::Client {
        return makeControlServer(weak.lock(), static_cast<std::uint32_t>(peer.pid));
      },
      &error);
  require(error);
  client = ipc::Connection::connect(paths.controlSocket, &error);
  require(error);
  remote = client->bootstrap<Control>();
}

void HostTest::startZarn() {
  zarn = std::make_shared<Zarn>();
  zarn->home = paths.home;
  NSErrorRef error;
  zarn->listener = ipc::Listener::listen(
      paths.daemonSocket,
      [home = paths.home, hosts = zarn->hosts](const ipc::PeerCredentials&)
          -> capnp::Capability::Client { return kj::heap<Zarn::Server>(home, hosts); },
      &error);
  require(error);
}

void HostTest::stopZarn() {
  if (zarn == nullptr) return;
  zarn->listener.reset();
  ipc::EventLoop::shared().runAndWait([&] { zarn->hosts->clear(); });
  zarn.reset();
}

void HostTest::signalFromZarn(const std::string& container) {
  ipc::EventLoop::shared().runAndWait([&] {
    for (auto& receiver : *zarn->hosts) {
      auto request = receiver.signalEnumeratorRequest();
      request.setContainer(container);
      ipc::EventLoop::shared().detach(request.send().ignoreResult().catch_([](auto&&) {}));
    }
  });
}

void HostTest::command(const std::string& name, const std::string& content) const {
  const auto path = home + "/fake/" + name;
  std::ofstream(path + ".new") << content;
  std::filesystem::rename(path + ".new", path);
}

void HostTest::countermand(const std::string& name) const {
  std::filesystem::remove(home + "/fake/" + name);
}

void HostTest::setItems(const std::map<std::string, std::uint64_t>& items) const {
  std::string lines;
  for (const auto& [identifier, version] : items) {
    lines += identifier + " " + std::to_string(version) + "\n";
  }
  command("items", lines);
}

void HostTest::signalFromExtension(const std::string& container) const {
  std::ofstream(home + "/fake/commands") << "signal " << container << std::endl;
}

NSErrorRef HostTest::item(const std::string& identifier, ItemFields* found) const {
  NSErrorRef domain;
  const auto transport = ipc::callAndWait(
      remote, &Control::Client::itemRequest, [&](auto params) { params.setIdentifier(identifier); },
      [&](auto results) {
        const auto result = results.getResult();
        if (result.isError()) {
          domain = ipc::decodeError(result.getError());
        } else if (found != nullptr) {
          *found = decodeItem(result.getItem());
        }
      });
  EXPECT_EQ(transport, nullptr) << "the host itself failed";
  return domain;
}

NSErrorRef HostTest::locate(const std::string& identifier, std::string* path) const {
  NSErrorRef domain;
  const auto transport = ipc::callAndWait(
      remote, &Control::Client::locateRequest,
      [&](auto params) { params.setIdentifier(identifier); },
      [&](auto results) {
        const auto result = results.getResult();
        if (result.isError()) {
          domain = ipc::decodeError(result.getError());
        } else if (path != nullptr) {
          *path = stringFromWire(result.getPath());
        }
      });
  EXPECT_EQ(transport, nullptr) << "the host itself failed";
  return domain;
}

NSErrorRef HostTest::identify(const std::string& path, std::string* identifier) const {
  NSErrorRef domain;
  const auto transport = ipc::callAndWait(
      remote, &Control::Client::identifyRequest,
      [&](auto params) { params.setPath(wireData(path)); },
      [&](auto results) {
        const auto result = results.getResult();
        if (result.isError()) {
          domain = ipc::decodeError(result.getError());
        } else if (identifier != nullptr) {
          *identifier = stringFromWire(result.getIdentifier());
        }
      });
  EXPECT_EQ(transport, nullptr) << "the host itself failed";
  return domain;
}

ipc::Remote<Listing> HostTest::list(const std::string& container) const {
  ipc::Remote<Listing> listing;
  EXPECT_EQ(nullptr,
            ipc::callAndWait(
                remote, &Control::Client::listRequest,
                [&](auto params) { params.setContainer(container); },
                [&](auto results) { listing = ipc::Remote<Listing>(results.getListing()); }));
  return listing;
}

NSErrorRef HostTest::next(const ipc::Remote<Listing>& listing,
                          std::vector<std::string>* identifiers, bool* more) {
  NSErrorRef domain;
  const auto transport = ipc::callAndWait(
      listing, &Listing::Client::nextRequest, [](auto) {},
      [&](auto results) {
        const auto result = results.getResult();
        if (result.isError()) {
          domain = ipc::decodeError(result.getError());
          return;
        }
        const auto page = result.getPage();
        if (more != nullptr) *more = page.getMore();
        if (identifiers == nullptr) return;
        for (const auto item : page.getItems()) {
          identifiers->push_back(stringFromWire(item.getIdentifier()));
        }
      });
  EXPECT_EQ(transport, nullptr) << "the host itself failed";
  return domain;
}

NSErrorRef HostTest::listAll(const std::string& container,
                             std::vector<std::string>* identifiers) const {
  const auto listing = list(container);
  bool more = true;
  while (more) {
    if (auto error = next(listing, identifiers, &more)) return error;
  }
  return nullptr;
}

std::shared_ptr<WatchedPicture> HostTest::watch(const std::string& container,
                                                ipc::Remote<protocol::Watch>* registration) {
  auto picture = std::make_shared<WatchedPicture>();
  EXPECT_EQ(nullptr, ipc::callAndWait(
                         remote, &Control::Client::watchRequest,
                         [&](auto params) {
                           params.setContainer(container);
                           params.setWatcher(kj::heap<WatcherServer>(picture));
                         },
                         [&](auto results) {
                           *registration = ipc::Remote<protocol::Watch>(results.getRegistration());
                         }));
  return picture;
}

HostTest::Status HostTest::status() const {
  Status told;
  EXPECT_EQ(nullptr, ipc::callAndWait(
                         remote, &Control::Client::statusRequest, [](auto) {},
                         [&](auto results) {
                           const auto status = results.getStatus();
                           told.extension = static_cast<pid_t>(status.getExtensionPid());
                           told.starts = status.getExtensionStarts();
                           told.daemonReachable = status.getDaemonReachable();
                           told.watches = status.getWatches();
                           told.enumerators = status.getEnumerators();
                           told.descriptors = status.getOpenDescriptors();
                           told.lastFailure = ipc::decodeOptional(status.getLastFailure());
                         }));
  return told;
}

bool HostTest::waitForStatus(const std::function<bool(const Status&)>& condition) const {
  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  while (!condition(status())) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    std::this_thread::yield();
  }
  return true;
}

}  // namespace yomber
