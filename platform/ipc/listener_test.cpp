#include "platform/ipc/listener.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstring>
#include <ctime>
#include <string>
#include <vector>

#include "platform/foundation/sanitized.h"
#include "platform/ipc/call.h"
#include "platform/ipc/connection.h"
#include "platform/ipc/deadlines.h"
#include "platform/ipc/test_echo_server.h"
#include "platform/ipc/test_error_lines.h"

namespace yomber::ipc {
namespace {

using test::Echo;

struct ListenerTest : ::testing::Test {
  test::TemporaryDirectory directory;
  std::string path = directory.file("socket");
  test::EchoStateRef state = std::make_shared<test::EchoState>();
  NSErrorRef error;

  std::unique_ptr<Listener> listen(Listener::Options options = {}) {
    return Listener::listen(
        path, [this](const PeerCredentials&) { return test::makeEcho(state); }, options, &error);
  }
  [[nodiscard]] bool exists() const { return ::access(path.c_str(), F_OK) == 0; }
  /// Whether the other end closes without having said anything.
  static bool closesSilently(int fd) {
    char byte = 0;
    return ::recv(fd, &byte, 1, 0) <= 0;
  }
  /// A new client is served.
  [[nodiscard]] bool serves() {
    const auto connection = Connection::connect(path, &error);
    return connection != nullptr && test::echoes(connection->bootstrap<Echo>(), 9);
  }
};

TEST_F(ListenerTest, ServesPeersAndTellsWhoTheyAre) {
  PeerCredentials seen;
  const auto listener = Listener::listen(path, [&](const PeerCredentials& peer) {
    seen = peer;
    return test::makeEcho(state);
  });
  ASSERT_NE(listener, nullptr);
  EXPECT_TRUE(serves());
  EXPECT_EQ(seen.pid, ::getpid());
  EXPECT_EQ(seen.uid, ::geteuid());
  struct stat status{};
  ASSERT_EQ(::stat(path.c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 0777U, 0600U);
}

TEST_F(ListenerTest, AStaleSocketIsReplaced) {
  // Closed without being unlinked, as a crash leaves it.
  ASSERT_TRUE(listenUnixSocket(path, &error));
  ASSERT_TRUE(exists());
  const auto listener = listen();
  ASSERT_NE(listener, nullptr) << error->description();
  EXPECT_TRUE(serves());
}

TEST_F(ListenerTest, ALiveOneIsLeftAlone) {
  const auto listener = listen();
  ASSERT_NE(listener, nullptr);
  EXPECT_EQ(listen(), nullptr);
  ASSERT_NE(error, nullptr);
  EXPECT_NE(error->localizedDescription().find("already running"), std::string::npos);
  EXPECT_NE(error->localizedDescription().find(path), std::string::npos);
  EXPECT_TRUE(serves());
}

TEST_F(ListenerTest, WhatIsNoSocketIsLeftAlone) {
  {
    const UniqueFd file(::open(path.c_str(), O_CREAT | O_WRONLY | O_CLOEXEC, 0600));
  }
  EXPECT_EQ(listen(), nullptr);
  ASSERT_NE(error, nullptr);
  EXPECT_NE(error->localizedDescription().find("no socket"), std::string::npos);
  EXPECT_TRUE(exists());
}

TEST_F(ListenerTest, AMissingDirectoryIsAClearError) {
  path = directory.file("missing/socket");
  EXPECT_EQ(listen(), nullptr);
  ASSERT_NE(error, nullptr);
  EXPECT_NE(error->localizedDescription().find(directory.file("missing")), std::string::npos);
}

TEST_F(ListenerTest, BeyondTheLimitPeersAreClosed) {
  const test::ErrorLines errors;
  const auto listener = listen({.maximumConnections = 2});
  ASSERT_NE(listener, nullptr);
  auto first = Connection::connect(path);
  const auto second = Connection::connect(path);
  ASSERT_TRUE(test::echoes(first->bootstrap<Echo>(), 1));
  ASSERT_TRUE(test::echoes(second->bootstrap<Echo>(), 2));
  EXPECT_EQ(listener->connectionCount(), 2U);
  const UniqueFd third = connectUnixSocket(path, &error);
  ASSERT_TRUE(third);
  EXPECT_TRUE(closesSilently(third.get()));
  EXPECT_TRUE(errors.has("at " + path + ": all 2 connections are taken"));
  // A place becomes free when a peer leaves.
  test::Tally left;
  first->onDisconnect([&](const NSErrorRef&) { left.add(); });
  first = nullptr;
  ASSERT_TRUE(left.waitFor(1));
  ASSERT_TRUE(state->destroyed.waitFor(1));
  EventLoop::shared().runAndWait([] {});
  EXPECT_TRUE(serves());
}

TEST_F(ListenerTest, AnotherUsersPeerIsClosed) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root to become another user";
  const test::ErrorLines errors;
  const auto listener = listen();
  ASSERT_NE(listener, nullptr);
  ASSERT_EQ(::chmod(directory.path().c_str(), 0711), 0);
  ASSERT_EQ(::chmod(path.c_str(), 0666), 0);
  const pid_t pid = ::fork();
  if (pid == 0) {
    if (::setgid(65534) != 0 || ::setuid(65534) != 0) ::_exit(99);
    sockaddr_un address{.sun_family = AF_UNIX, .sun_path = {}};
    path.copy(address.sun_path, sizeof address.sun_path - 1);
    const int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (::connect(fd, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) ::_exit(2);
    ::_exit(closesSilently(fd) ? 0 : 3);
  }
  int status = 0;
  ::waitpid(pid, &status, 0);
  EXPECT_TRUE(WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 0);
  EXPECT_EQ(state->destroyed.value(), 0U) << "nothing was made for it";
  EXPECT_EQ(listener->connectionCount(), 0U);
  // The line comes before the closing.
  EXPECT_TRUE(errors.has("Refused process " + std::to_string(pid) + " of user 65534 at " + path));
  EXPECT_TRUE(serves());
}

TEST_F(ListenerTest, RandomBytesHarmNobody) {
  const auto listener = listen();
  ASSERT_NE(listener, nullptr);
  const auto steady = Connection::connect(path);
  ASSERT_NE(steady, nullptr);
  for (std::uint64_t seed = 1; seed <= 200; ++seed) {
    const UniqueFd raw = connectUnixSocket(path, &error);
    ASSERT_TRUE(raw) << error->description();
    auto bytes = test::randomBytes(seed, 8 + seed * 7);
    // Half of them begin like a real message, so that what is in it gets parsed too.
    if (seed % 2 == 0) {
      const std::uint32_t words = static_cast<std::uint32_t>(bytes.size() / 8 - 1);
      const std::uint32_t header[2] = {0, words};
      std::memcpy(bytes.data(), header, sizeof header);
    }
    ASSERT_EQ(::send(raw.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL),
              static_cast<ssize_t>(bytes.size()));
    ::shutdown(raw.get(), SHUT_WR);
    char buffer[4096];
    while (::recv(raw.get(), buffer, sizeof buffer, 0) > 0) {
    }
    if (seed % 20 == 0) {
      EXPECT_TRUE(test::echoes(steady->bootstrap<Echo>(), seed));
    }
  }
  EXPECT_TRUE(serves());
}

TEST_F(ListenerTest, OutOfDescriptorsItWaitsAndGoesOn) {
  if (kHasAddressSanitizer) GTEST_SKIP() << "the sanitizer needs descriptors to look at memory";
  const auto listener = listen();
  ASSERT_NE(listener, nullptr);
  ASSERT_TRUE(serves());
  ASSERT_TRUE(state->destroyed.waitFor(1));
  EventLoop::shared().runAndWait([] {});  // that connection's descriptor is closed by now
  UniqueFd client(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  rlimit limit{};
  ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &limit), 0);
  // No descriptor above the highest that is open, and none free below it.
  std::vector<UniqueFd> fillers;
  const UniqueFd highest = duplicateDescriptor(client.get());
  rlimit tight = limit;
  tight.rlim_cur = static_cast<rlim_t>(highest.get()) + 1;
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &tight), 0);
  for (int fd = ::dup(client.get()); fd >= 0; fd = ::dup(client.get())) fillers.emplace_back(fd);

  sockaddr_un address{.sun_family = AF_UNIX, .sun_path = {}};
  path.copy(address.sun_path, sizeof address.sun_path - 1);
  ASSERT_EQ(::connect(client.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address),
            0);
  const auto cpuBefore = ::clock();
  // Several pauses long; one that spins shows in the processor time.
  Deadlines::Entry entry;
  Gate waited;
  EventLoop::shared().runAndWait([&] {
    EventLoop::shared().deadlines().set(entry, std::chrono::milliseconds(300),
                                        [&] { waited.open(); });
  });
  waited.wait();
  EXPECT_LT(::clock() - cpuBefore, CLOCKS_PER_SEC / 10);
  EXPECT_EQ(listener->connectionCount(), 0U);

  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &limit), 0);
  fillers.clear();
  const auto connection =
      EventLoop::shared().runAndWait([&] { return Connection::accepted(std::move(client), {}); });
  EXPECT_TRUE(test::echoes(connection->bootstrap<Echo>(), 4)) << "it was accepted after all";
}

TEST_F(ListenerTest, DestructionClosesEverything) {
  auto listener = listen();
  ASSERT_NE(listener, nullptr);
  const auto connection = Connection::connect(path);
  ASSERT_TRUE(test::echoes(connection->bootstrap<Echo>(), 1));
  test::Tally ended;
  connection->onDisconnect([&](const NSErrorRef&) { ended.add(); });
  listener = nullptr;
  EXPECT_FALSE(exists());
  EXPECT_TRUE(ended.waitFor(1));
  EXPECT_TRUE(state->destroyed.waitFor(1));
  EXPECT_NE(listen(), nullptr);
}

TEST_F(ListenerTest, APathThatIsAnothersByNowStays) {
  auto listener = listen();
  ASSERT_NE(listener, nullptr);
  ASSERT_EQ(::unlink(path.c_str()), 0);
  const auto successor = listen();
  ASSERT_NE(successor, nullptr);
  listener = nullptr;
  EXPECT_TRUE(exists());
  EXPECT_TRUE(serves());
}

}  // namespace
}  // namespace yomber::ipc
