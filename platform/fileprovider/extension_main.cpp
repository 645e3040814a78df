#include "platform/fileprovider/extension_main.h"

#include <fcntl.h>
#include <sys/prctl.h>
#include <sys/socket.h>

#include <charconv>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <utility>

#include "platform/fileprovider/extension_server.h"
#include "platform/fileprovider/item_codec.h"
#include "platform/fileprovider/manager.h"
#include "platform/fileprovider/wire_item.h"
#include "platform/foundation/descriptor_limit.h"
#include "platform/foundation/drive_paths.h"
#include "platform/foundation/log.h"
#include "platform/foundation/log_sinks.h"
#include "platform/foundation/shared_heaps.h"
#include "platform/ipc/call.h"
#include "platform/ipc/connection.h"
#include "platform/ipc/error_codec.h"

namespace yomber {
namespace {

constexpr int kNotStartedByHost = 64;

/// -1 when the environment names no socket. No process that we start inherits it.
int takeInheritedSocket() {
  const char* const text = std::getenv(kExtensionDescriptorVariable);
  if (text == nullptr) return -1;
  int fd = -1;
  const char* const end = text + std::strlen(text);
  const auto parsed = std::from_chars(text, end, fd);
  const bool isNumber = parsed.ec == std::errc() && parsed.ptr == end && fd >= 0;
  (void)unsetenv(kExtensionDescriptorVariable);
  int type = 0;
  socklen_t length = sizeof type;
  if (!isNumber || getsockopt(fd, SOL_SOCKET, SO_TYPE, &type, &length) != 0) return -1;
  return fcntl(fd, F_SETFD, FD_CLOEXEC) == 0 ? fd : -1;
}

/// Signals over the connection to the host.
class HostTransport final : public NSFileProviderManager::Transport {
 public:
  explicit HostTransport(ipc::Remote<protocol::ExtensionHost> host) : host_(std::move(host)) {}

  void signalEnumerator(const NSFileProviderItemIdentifier& container,
                        std::function<void(NSErrorRef)> completionHandler) override {
    using Host = protocol::ExtensionHost;
    (void)ipc::call(
        host_, &Host::Client::signalEnumeratorRequest,
        [container](Host::SignalEnumeratorParams::Builder params) {
          params.setContainer(wireText(container));
        },
        [handler = std::move(completionHandler)](
            NSErrorRef error, const Host::SignalEnumeratorResults::Reader* results) {
          if (results != nullptr) error = ipc::decodeOptional(results->getResult());
          if (handler) handler(std::move(error));
        });
  }

 private:
  const ipc::Remote<protocol::ExtensionHost> host_;
};

int refuse(const char* program) {
  (void)std::fprintf(stderr,
                     "%s: this program is started by fileproviderd, never by hand; start the drive "
                     "with 'yomber up'\n",
                     program);
  return kNotStartedByHost;
}

}  // namespace

int NSExtensionMain(
    int argc, char** argv,
    const std::function<std::shared_ptr<NSFileProviderExtension>()>& makeExtension) {
  const char* const program = argc > 0 ? argv[0] : "extension";
  const int socket = takeInheritedSocket();
  if (socket < 0) return refuse(program);
  (void)prctl(PR_SET_PDEATHSIG, SIGKILL);
  (void)std::signal(SIGPIPE, SIG_IGN);
  raiseDescriptorLimit();
  shareHeaps();
  openLog("qs-fileprovider", DrivePaths::forDefaultHome());
  registerItemsInErrors();

  const auto extension = makeExtension();
  NSErrorRef error;
  const auto connection =
      ipc::Connection::adopt(socket, [extension] { return serveExtension(extension); }, &error);
  if (connection == nullptr) {
    log_error(defaultLog(), "[ERROR] no connection to the host: %@", error);
    return refuse(program);
  }
  ipc::Gate hostIsGone;
  connection->onDisconnect([&hostIsGone](const NSErrorRef&) { hostIsGone.open(); });
  auto& manager = NSFileProviderManager::defaultManager();
  manager.setTransport(
      std::make_shared<HostTransport>(connection->bootstrap<protocol::ExtensionHost>()));
  hostIsGone.wait();
  manager.setTransport(nullptr);
  return 0;
}

}  // namespace yomber
