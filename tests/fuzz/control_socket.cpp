// Any bytes at the host's socket, with an extension process and a small daemon behind it.

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <memory>
#include <string>

#include "fileproviderd/control_server.h"
#include "fileproviderd/host.h"
#include "platform/fileprovider/item_codec.h"
#include "platform/fileprovider/wire_item.h"
#include "platform/foundation/temporary_directory.h"
#include "platform/ipc/event_loop.h"
#include "tests/fuzz/quiet_log.h"
#include "tests/fuzz/socket_target.h"

namespace yomber::fuzz {
namespace {

using protocol::Control;
using protocol::Daemon;

constexpr const char* kKnownIdentifier = "item0";

class Registration final : public protocol::Registration::Server {};

/// What the host asks of zarn.
class TinyDaemon final : public Daemon::Server {
 public:
  explicit TinyDaemon(std::string home) : home_(std::move(home)) {}

 protected:
  kj::Promise<void> describe(DescribeContext context) override {
    context.getResults().setHome(wireData(home_));
    return kj::READY_NOW;
  }
  kj::Promise<void> registerHost(RegisterHostContext context) override {
    context.getResults().setRegistration(kj::heap<Registration>());
    return kj::READY_NOW;
  }
  kj::Promise<void> urlForItemIdentifier(UrlForItemIdentifierContext context) override {
    context.getResults().initResult().setPath(wireData("/root"));
    return kj::READY_NOW;
  }

 private:
  const std::string home_;
};

/// What the fake extension answers with: more than one page of items.
void commandExtension(const std::string& home) {
  std::filesystem::create_directory(home + "/fake");
  std::ofstream(home + "/fake/root").put('\n');
  std::ofstream items(home + "/fake/items");
  for (int i = 0; i < 250; ++i) items << "item" << i << " 1\n";
}

DrivePaths makePaths(const std::string& home) {
  const auto paths = DrivePaths::forHome(home);
  expect(paths.create() == nullptr, "the home was made");
  commandExtension(paths.home);
  return paths;
}

/// Its temporary place is removed by the process that made it, when it ends in order.
TemporaryDirectory& place() {
  static TemporaryDirectory directory;
  return directory;
}

/// Never destroyed: threads may use it to the very end.
struct Server {
  const DrivePaths paths = makePaths(place() / "home");
  ListeningServer<Daemon> daemon{paths.daemonSocket, [home = paths.home](const auto&) {
                                   return capnp::Capability::Client(kj::heap<TinyDaemon>(home));
                                 }};
  const std::shared_ptr<Host> host = ipc::EventLoop::shared().runAndWait([this] {
    Host::Options options;
    options.paths = paths;
    options.extensionProgram = YOMBER_FAKE_EXTENSION;
    auto made = Host::create(std::move(options));
    made->start();
    return made;
  });
  ListeningServer<Control> control{paths.controlSocket, [host = host](const auto&) {
                                     return capnp::Capability::Client(makeControlServer(host));
                                   }};

  void mustAnswer() {
    std::string name;
    expectAnswer(ipc::callAndWait(
        control.remote, &Control::Client::itemRequest,
        [](Control::ItemParams::Builder params) { params.setIdentifier(kKnownIdentifier); },
        [&](const Control::ItemResults::Reader& results) {
          if (results.getResult().isItem()) {
            name = stringFromWire(results.getResult().getItem().getFilename());
          }
        },
        kPatience));
    expect(name == std::string("name of ") + kKnownIdentifier, "the extension still answers");
  }
};

Target& target() {
  (void)unsetenv("XDG_RUNTIME_DIR");
  quietLogs();
  registerItemsInErrors();
  (void)place();
  static auto* const server = new Server;
  static auto* const made =
      new Target{.connect = [] { return server->control.connect(); },
                 .mustAnswer = [] { server->mustAnswer(); },
                 .openConnections = [] { return server->control.otherConnections(); }};
  return *made;
}

}  // namespace
}  // namespace yomber::fuzz

YOMBER_FUZZ_MUTATE_CHUNKS

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  static yomber::fuzz::Target& target = yomber::fuzz::target();
  yomber::fuzz::attack(target, {data, size});
  return 0;
}
