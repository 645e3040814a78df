// Any bytes at zarn's socket, with a real drive behind it.

#include <sys/xattr.h>

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <memory>
#include <string>

#include "platform/fileprovider/constants.h"
#include "platform/fileprovider/item_codec.h"
#include "platform/fileprovider/wire_item.h"
#include "tests/fuzz/fixed_home.h"
#include "tests/fuzz/quiet_log.h"
#include "tests/fuzz/socket_target.h"
#include "zarn/daemon_server.h"
#include "zarn/drive.h"

namespace yomber::fuzz {
namespace {

using protocol::Daemon;

/// Documents d:2000… and, in the folder i:3000, d:3001….
void fillTree(const std::string& root) {
  const auto mark = [](const std::string& path, const char* name, const std::string& value) {
    (void)setxattr(path.c_str(), name, value.data(), value.size(), 0);
  };
  const std::string folder = root + "/folder";
  std::filesystem::create_directories(folder);
  mark(folder, "user.yomber.id", "3000");
  for (int i = 0; i < 12; ++i) {
    const std::string number = std::to_string(i);
    const std::string document = root + "/item " + number;
    std::ofstream(document) << number;
    mark(document, "user.yomber.id", std::to_string(2000 + i));
    if (i % 2 == 0) mark(document, "user.xdg.tags", "red,green");
    std::ofstream(folder + "/inner " + number) << number;
    mark(folder + "/inner " + number, "user.yomber.id", std::to_string(3001 + i));
  }
}

std::shared_ptr<Drive> openDrive() {
  claimHome(kDaemonHome);
  fillTree(kDaemonRoot);
  std::filesystem::permissions(std::string(kDaemonHome) + "/tree",
                               std::filesystem::perms::owner_all);
  Drive::Options options;
  options.applications = {std::string(kDaemonHome) + "/applications"};
  NSErrorRef error;
  auto drive = Drive::open(DrivePaths::forHome(kDaemonHome), options, &error);
  if (error) (void)std::fprintf(stderr, "%s\n", error->description().c_str());
  expect(drive != nullptr, "the drive opened");
  expect(drive->account->signIn("ada") == nullptr, "somebody is signed in");
  drive->start();
  return drive;
}

/// Never destroyed: threads may use it to the very end.
struct Server {
  const std::shared_ptr<Drive> drive = openDrive();
  ListeningServer<Daemon> daemon{drive->paths.daemonSocket, [drive = drive](const auto&) {
                                   return capnp::Capability::Client(kj::heap<DaemonServer>(drive));
                                 }};

  void mustAnswer() {
    std::string path;
    expectAnswer(ipc::callAndWait(
        daemon.remote, &Daemon::Client::urlForItemIdentifierRequest,
        [](Daemon::UrlForItemIdentifierParams::Builder params) {
          params.setIdentifier(NSFileProviderRootContainerItemIdentifier);
        },
        [&](const Daemon::UrlForItemIdentifierResults::Reader& results) {
          if (results.getResult().isPath()) path = stringFromWire(results.getResult().getPath());
        },
        kPatience));
    // Any other item may have been moved or deleted.
    expect(path == kDaemonRoot, "the root is still where it was");
    // An input may have signed out, and in under another name; the next one shall get further.
    while (!drive->account->current()) (void)drive->account->signIn("ada");
  }
};

Target& target() {
  (void)unsetenv("XDG_RUNTIME_DIR");
  quietLogs();
  registerItemsInErrors();
  static auto* const server = new Server;
  static auto* const made =
      new Target{.connect = [] { return server->daemon.connect(); },
                 .mustAnswer = [] { server->mustAnswer(); },
                 .openConnections = [] { return server->daemon.otherConnections(); }};
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
