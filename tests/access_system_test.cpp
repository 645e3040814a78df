// Who may talk to a drive: its user's processes, and nobody else's.

#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <cstdint>
#include <filesystem>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "platform/foundation/log_sinks.h"
#include "tests/harness/test_drive.h"

namespace yomber::testing {
namespace {

namespace fs = std::filesystem;

constexpr uid_t kNobody = 65534;

/// How a peer is treated that asks a socket for what it serves.
enum class Reception : std::uint8_t { Answered, HungUp, Silence, Unreachable, NotThatUser };

std::ostream& operator<<(std::ostream& out, Reception reception) {
  constexpr std::array kTexts{"answered", "hung up on", "left waiting", "not let through",
                              "unable to become that user"};
  return out << kTexts[static_cast<std::size_t>(reception)];
}

Reception askForTheBootstrap(const std::string& path) {
  sockaddr_un address{.sun_family = AF_UNIX, .sun_path = {}};
  path.copy(address.sun_path, sizeof address.sun_path - 1);
  const int peer = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (connect(peer, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
    return Reception::Unreachable;
  }
  // One segment of five words: a message whose kind is "bootstrap", for question 0.
  const std::array<std::uint32_t, 12> request{0, 5, 0, 0x10001, 8, 0, 0, 0x10001, 0, 0, 0, 0};
  (void)send(peer, request.data(), sizeof request, MSG_NOSIGNAL);
  pollfd waiting{peer, POLLIN, 0};
  constexpr int kPatienceMilliseconds = 20'000;
  if (poll(&waiting, 1, kPatienceMilliseconds) != 1) return Reception::Silence;
  std::array<char, 64> reply{};
  return recv(peer, reply.data(), reply.size(), 0) > 0 ? Reception::Answered : Reception::HungUp;
}

/// The same from a process of that user.
Reception receptionOf(uid_t user, const std::string& path) {
  const pid_t child = fork();
  if (child == 0) {
    if (user != geteuid() && (setgid(user) != 0 || setuid(user) != 0)) {
      _exit(static_cast<int>(Reception::NotThatUser));
    }
    _exit(static_cast<int>(askForTheBootstrap(path)));
  }
  int status = 0;
  EXPECT_EQ(waitpid(child, &status, 0), child);
  EXPECT_TRUE(WIFEXITED(status));
  return static_cast<Reception>(WEXITSTATUS(status));
}

class Access : public ::testing::Test {
 protected:
  [[nodiscard]] std::string sockets() const { return drive_.home() + "/run"; }
  [[nodiscard]] std::vector<std::string> socketPaths() const {
    std::vector<std::string> paths;
    for (const auto& entry : fs::directory_iterator(sockets())) {
      if (entry.is_socket()) paths.push_back(entry.path());
    }
    return paths;
  }
  /// Takes away what the file system itself keeps others from.
  void openTheWay() const {
    for (fs::path place = sockets(); place != fs::temp_directory_path();
         place = place.parent_path()) {
      ASSERT_EQ(chmod(place.c_str(), 0711), 0);
    }
    for (const std::string& path : socketPaths()) ASSERT_EQ(chmod(path.c_str(), 0666), 0);
  }
  void closeTheWay() const {
    for (const std::string& place : {sockets(), drive_.home()}) {
      ASSERT_EQ(chmod(place.c_str(), S_IRWXU), 0);
    }
  }

  [[nodiscard]] bool logged(const std::string& text) const {
    return eventually([&] {
      return drive_.yomber({"log", "--lines", "100000"}).output.find(text) != std::string::npos;
    });
  }

  TestDrive drive_;
};

TEST_F(Access, AnotherUsersProcessIsHungUpOnAtEverySocket) {
  if (geteuid() != 0) GTEST_SKIP() << "only root can become another user";
  drive_.up();
  ASSERT_GE(socketPaths().size(), 2U) << "zarn's and the host's";
  for (const std::string& path : socketPaths()) {
    EXPECT_EQ(receptionOf(kNobody, path), Reception::Unreachable) << path;
  }
  openTheWay();
  for (const std::string& path : socketPaths()) {
    EXPECT_EQ(receptionOf(kNobody, path), Reception::HungUp) << path;
    EXPECT_EQ(receptionOf(geteuid(), path), Reception::Answered) << path;
  }
  closeTheWay();
  if (logsToJournal()) GTEST_SKIP() << "this machine logs to its journal";
  for (const std::string& path : socketPaths()) {
    EXPECT_TRUE(logged("of user " + std::to_string(kNobody) + " at " + path)) << path;
  }
}

}  // namespace
}  // namespace yomber::testing
