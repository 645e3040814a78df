// Serves echoes at the socket path that it is given, until it is killed. Writes one byte to its
// standard output when it listens.

#include <unistd.h>

#include <cstdio>

#include "platform/ipc/listener.h"
#include "platform/ipc/test_echo_server.h"

int main(int argc, char** argv) {
  using namespace yomber;
  if (argc != 2) {
    std::fprintf(stderr, "usage: %s SOCKET\n", argv[0]);
    return 2;
  }
  const auto state = std::make_shared<ipc::test::EchoState>();
  NSErrorRef error;
  const auto listener = ipc::Listener::listen(
      argv[1], [state](const ipc::PeerCredentials&) { return ipc::test::makeEcho(state); }, &error);
  if (!listener) {
    std::fprintf(stderr, "%s\n", error->localizedDescription().c_str());
    return 1;
  }
  (void)!::write(STDOUT_FILENO, "r", 1);
  for (;;) ::pause();
}
