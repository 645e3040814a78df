#pragma once

#include <sys/types.h>

#include <optional>
#include <string>
#include <utility>

#include "platform/foundation/error.h"

namespace yomber::ipc {

/// A descriptor that is closed with its owner.
class UniqueFd {
 public:
  UniqueFd() = default;
  explicit UniqueFd(int fd) : fd_(fd) {}
  UniqueFd(UniqueFd&& other) noexcept : fd_(other.release()) {}
  UniqueFd& operator=(UniqueFd&& other) noexcept {
    reset(other.release());
    return *this;
  }
  ~UniqueFd() { reset(); }

  [[nodiscard]] int get() const { return fd_; }
  [[nodiscard]] int release() { return std::exchange(fd_, -1); }
  void reset(int fd = -1);
  explicit operator bool() const { return fd_ >= 0; }

 private:
  int fd_ = -1;
};

/// Who is at the other end, as the kernel says.
struct PeerCredentials {
  pid_t pid = 0;
  uid_t uid = 0;
  gid_t gid = 0;
};

/// Another descriptor of the same open file, closed on exec. Empty with an error when there is none
/// left.
UniqueFd duplicateDescriptor(int fd, NSErrorRef* error = nullptr);

/// Both ends of a connected stream socket, closed on exec. False with an error when out of
/// descriptors. An end is handed to a peer as a descriptor on a capability and then adopted
/// (Connection::adopt) on either side.
bool makeSocketPair(UniqueFd& first, UniqueFd& second, NSErrorRef* error = nullptr);

/// Who made the connection's other end. Nothing when `fd` is no connected Unix socket.
std::optional<PeerCredentials> peerCredentials(int fd);
/// Whether descriptors, of which there are none left, are what `number` says.
[[nodiscard]] bool isDescriptorShortage(int number);

/// A blocking stream socket, closed on exec, connected to the listener at `path`. Waits at most
/// `kConnectSeconds` for a place in its queue. Empty with an error that names the path.
UniqueFd connectUnixSocket(const std::string& path, NSErrorRef* error);
inline constexpr int kConnectSeconds = 5;

/// A non-blocking listening socket at `path`, mode 0600. A socket there on which nobody answers is
/// replaced; one on which somebody does, and anything that is no socket, is left alone. Empty with
/// an error that names the path.
UniqueFd listenUnixSocket(const std::string& path, NSErrorRef* error);

}  // namespace yomber::ipc
