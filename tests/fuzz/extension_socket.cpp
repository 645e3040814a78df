// Any bytes at the socket pair between host and extension, at the extension's end, with the real
// extension and a scripted daemon behind it.

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <memory>
#include <string>

#include "platform/fileprovider/extension_server.h"
#include "platform/fileprovider/item_codec.h"
#include "platform/ostrell/scripted_daemon.h"
#include "provider/extension/extension.h"
#include "tests/fuzz/quiet_log.h"
#include "tests/fuzz/socket_target.h"

namespace yomber::fuzz {
namespace {

using protocol::Extension;

constexpr const char* kKnownIdentifier = "d:2000";
constexpr const char* kKnownName = "item 0";

/// Documents d:2000… and, in the folder i:3000, d:3001….
void fill(ScriptedDaemon& daemon) {
  daemon.addItem(scriptedFolder(3000, "folder"), daemon.root() + "/folder");
  for (std::uint64_t i = 0; i < 250; ++i) {
    const std::string name = "item " + std::to_string(i);
    daemon.addItem(scriptedDocument(2000 + i, name), daemon.root() + "/" + name);
    daemon.addItem(scriptedDocument(3001 + i, name, "i:3000"), daemon.root() + "/folder/" + name);
  }
}

ScriptedDaemon& scriptedDaemon() {
  static ScriptedDaemon daemon;
  return daemon;
}

/// Never destroyed: threads may use it to the very end.
class Server {
 public:
  Server() : extension_(QSFileProviderExtension::init()) {
    fill(scriptedDaemon());
    ipc::UniqueFd ours;
    ipc::UniqueFd theirs;
    expect(ipc::makeSocketPair(ours, theirs), "a pair was made");
    host_ = ipc::Connection::adopt(ours.release());
    served_ = adopt(std::move(theirs));
    remote_ = host_->bootstrap<Extension>();
  }

  ipc::UniqueFd connect() {
    ipc::UniqueFd ours;
    ipc::UniqueFd theirs;
    expect(ipc::makeSocketPair(ours, theirs), "a pair was made");
    attacked_ = adopt(std::move(theirs));
    ++open_;
    attacked_->onDisconnect([this](const NSErrorRef&) { --open_; });
    return ours;
  }

  void mustAnswer() {
    scriptedDaemon().forgetCalls();
    std::string name;
    expectAnswer(ipc::callAndWait(
        remote_, &Extension::Client::itemForIdentifierRequest,
        [](Extension::ItemForIdentifierParams::Builder params) {
          params.setIdentifier(kKnownIdentifier);
        },
        [&](const Extension::ItemForIdentifierResults::Reader& results) {
          if (results.getResult().isItem()) {
            name = stringFromWire(results.getResult().getItem().getFilename());
          }
        },
        kPatience));
    expect(name == kKnownName, "the extension still answers");
  }

  [[nodiscard]] std::size_t openConnections() const { return open_; }

 private:
  ipc::Connection::Ref adopt(ipc::UniqueFd socket) {
    auto connection = ipc::Connection::adopt(
        socket.release(), [extension = extension_] { return serveExtension(extension); });
    expect(connection != nullptr, "a socket was adopted");
    return connection;
  }

  const std::shared_ptr<QSFileProviderExtension> extension_;
  ipc::Connection::Ref host_;
  ipc::Connection::Ref served_;
  ipc::Connection::Ref attacked_;
  ipc::Remote<Extension> remote_;
  std::atomic<std::size_t> open_{0};
};

Target& target() {
  quietLogs();
  (void)scriptedDaemon();
  static auto* const server = new Server;
  static auto* const made = new Target{.connect = [] { return server->connect(); },
                                       .isPair = true,
                                       .mustAnswer = [] { server->mustAnswer(); },
                                       .openConnections = [] { return server->openConnections(); }};
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
