// Serves echoes at a socket path by asking whoever serves them at another: a relay that does
// nothing else. Writes a line to its standard output when it listens.

#include <unistd.h>

#include <cstdio>

#include "platform/ipc/connection.h"
#include "platform/ipc/listener.h"
#include "platform/ipc/remote.h"
#include "platform/ipc/test_echo.capnp.h"

namespace {

using namespace yomber;
using ipc::test::Echo;

class RelayServer final : public Echo::Server {
 public:
  explicit RelayServer(ipc::Remote<Echo> behind) : behind_(std::move(behind)) {}

 protected:
  kj::Promise<void> echo(EchoContext context) override {
    auto request = behind_.client().echoRequest();
    request.setValue(context.getParams().getValue());
    request.setData(context.getParams().getData());
    return request.send().then([context](auto&& response) mutable {
      auto results = context.getResults();
      results.setValue(response.getValue());
      results.setData(response.getData());
    });
  }

 private:
  const ipc::Remote<Echo> behind_;
};

}  // namespace

int main(int argc, char** argv) {
  if (argc != 3) {
    std::fprintf(stderr, "usage: %s SOCKET SOCKET_BEHIND\n", argv[0]);
    return 2;
  }
  NSErrorRef error;
  const auto connection = ipc::Connection::connect(argv[2], &error);
  if (!connection) {
    std::fprintf(stderr, "%s\n", error->localizedDescription().c_str());
    return 1;
  }
  const auto behind = connection->bootstrap<Echo>();
  const auto listener = ipc::Listener::listen(
      argv[1],
      [behind](const ipc::PeerCredentials&) -> capnp::Capability::Client {
        return kj::heap<RelayServer>(behind);
      },
      &error);
  if (!listener) {
    std::fprintf(stderr, "%s\n", error->localizedDescription().c_str());
    return 1;
  }
  (void)!::write(STDOUT_FILENO, "ready\n", 6);
  for (;;) ::pause();
}
