// A client of zarn that watches a drive's root, lists it, and then does nothing until it is killed:
// daemon_visitor HOME prints "watching", and the number of items.

#include <unistd.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>

#include "platform/fileprovider/item_codec.h"
#include "platform/foundation/drive_paths.h"
#include "platform/ipc/call.h"
#include "platform/ipc/connection.h"
#include "platform/ipc/error_codec.h"
#include "protocols/daemon.capnp.h"

namespace yomber::testing {
namespace {

using protocol::Daemon;

void require(const NSErrorRef& error) {
  if (error == nullptr) return;
  (void)std::fprintf(stderr, "daemon_visitor: %s\n", error->description().c_str());
  std::_Exit(1);
}

class Receiver final : public protocol::ItemReceiver::Server {};

/// What keeps the watch.
ipc::Remote<protocol::ItemSender> watch(const ipc::Remote<Daemon>& daemon,
                                        const std::string& root) {
  ipc::Remote<protocol::ItemSender> sender;
  require(ipc::callAndWait(
      daemon, &Daemon::Client::getItemUpdateSenderRequest,
      [](auto params) { params.setReceiver(kj::heap<Receiver>()); },
      [&](auto results) {
        if (results.getResult().isError())
          require(ipc::decodeError(results.getResult().getError()));
        sender = ipc::Remote<protocol::ItemSender>(results.getResult().getSender());
      }));
  constexpr std::uint32_t kUpdatesAndDeletionsOfChildren = 19;
  require(ipc::callAndWait(
      sender, &protocol::ItemSender::Client::watchItemRequest,
      [&](auto params) {
        params.setPath(wireData(root));
        params.setOptions(kUpdatesAndDeletionsOfChildren);
      },
      [](auto results) { require(ipc::decodeOptional(results.getFailure())); }));
  return sender;
}

std::size_t list(const ipc::Remote<Daemon>& daemon) {
  constexpr std::uint32_t kPageSize = 200;
  std::size_t count = 0;
  std::uint64_t offset = 0;
  do {
    require(ipc::callAndWait(
        daemon, &Daemon::Client::enumerateItemsInFolderRequest,
        [&](auto params) {
          params.setOffset(offset);
          params.setLimit(kPageSize);
        },
        [&](auto results) {
          const auto result = results.getResult();
          if (result.isError()) require(ipc::decodeError(result.getError()));
          count += result.getPage().getItems().size();
          offset = result.getPage().getNextOffset();
        }));
  } while (offset != 0);
  return count;
}

int visit(const char* home) {
  const DrivePaths paths = DrivePaths::forHome(home);
  NSErrorRef error;
  const auto connection = ipc::Connection::connect(paths.daemonSocket, &error);
  require(error);
  const auto daemon = connection->bootstrap<Daemon>();
  std::string root;
  require(ipc::callAndWait(
      daemon, &Daemon::Client::describeRequest, [](auto) {},
      [&](auto results) { root = stringFromWire(results.getRoot()); }));
  const auto sender = watch(daemon, root);
  (void)std::puts("watching");
  (void)std::fflush(stdout);
  (void)std::printf("%zu\n", list(daemon));
  (void)std::fflush(stdout);
  for (;;) pause();
}

}  // namespace
}  // namespace yomber::testing

int main(int argc, char** argv) {
  if (argc != 2) {
    (void)std::fprintf(stderr, "usage: daemon_visitor HOME\n");
    return 64;
  }
  return yomber::testing::visit(argv[1]);
}
