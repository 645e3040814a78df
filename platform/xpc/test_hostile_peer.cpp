#include "platform/xpc/test_hostile_peer.h"

#include <gtest/gtest.h>
#include <sys/socket.h>

#include <array>
#include <cstdint>
#include <utility>

#include "platform/ipc/message_stream.h"
#include "platform/xpc/listener_endpoint.h"

namespace yomber::test {

std::string recordedCalls(const NSXPCInterfaceRef& interface,
                          const std::function<void(const NSXPCConnectionRef& client)>& makeCalls) {
  ipc::UniqueFd ours;
  ipc::UniqueFd theirs;
  EXPECT_TRUE(ipc::makeSocketPair(ours, theirs));
  EXPECT_EQ(ipc::MessageStream::sendCredentials(ours.get()), 0);
  const auto client = NSXPCConnection::initWithListenerEndpoint(
      std::make_shared<NSXPCListenerEndpoint>(std::move(theirs)));
  client->setRemoteObjectInterface(interface);
  client->resume();
  makeCalls(client);
  client->invalidate();
  std::string bytes;
  std::array<char, 4096> buffer{};
  for (;;) {
    const ssize_t count = ::recv(ours.get(), buffer.data(), buffer.size(), 0);
    if (count <= 0) break;
    bytes.append(buffer.data(), static_cast<std::size_t>(count));
  }
  EXPECT_GT(bytes.size(), 200U);
  return bytes.substr(1);
}

std::string mutated(std::string bytes, std::mt19937_64& random) {
  const auto anywhere = [&] { return random() % bytes.size(); };
  for (std::uint64_t changes = 1 + random() % 4; changes > 0; --changes) {
    switch (random() % 4) {
      case 0:
        bytes[anywhere()] = static_cast<char>(random());
        break;
      case 1:
        bytes[anywhere()] ^= static_cast<char>(1U << random() % 8);
        break;
      case 2:
        bytes.resize(1 + anywhere());
        break;
      default: {
        const std::size_t begin = anywhere() & ~std::size_t{7};
        bytes.insert(begin, bytes.substr(begin, 8 * (1 + random() % 8)));
      }
    }
  }
  return bytes;
}

void speakTo(const std::shared_ptr<NSXPCListenerDelegate>& delegate, const std::string& bytes) {
  const auto listener = NSXPCListener::anonymousListener();
  listener->setDelegate(delegate);
  const auto endpoint = listener->endpoint();
  listener->resume();
  const ipc::UniqueFd socket = endpoint->takeSocket();
  ASSERT_EQ(ipc::MessageStream::sendCredentials(socket.get()), 0);
  (void)::send(socket.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL);
  (void)::shutdown(socket.get(), SHUT_WR);
  std::array<char, 4096> buffer{};
  while (::recv(socket.get(), buffer.data(), buffer.size(), 0) > 0) {
  }
}

void speakMutations(const std::string& valid, int rounds,
                    const std::function<void(const std::string& bytes)>& speak) {
  speak(valid);
  for (int round = 0; round < rounds && !::testing::Test::HasFatalFailure(); ++round) {
    std::mt19937_64 random(static_cast<std::uint64_t>(round));
    SCOPED_TRACE("round " + std::to_string(round));
    std::string bytes = mutated(valid, random);
    if (round % 10 == 0) {
      for (char& byte : bytes) byte = static_cast<char>(random());
    }
    speak(bytes);
  }
}

}  // namespace yomber::test
