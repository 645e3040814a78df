#include "platform/ipc/unix_socket.h"

#include "platform/foundation/descriptor_path.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/time.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstddef>
#include <cstring>

namespace yomber::ipc {

namespace {

constexpr int kBacklog = 128;

/// A POSIX-domain error of `number` that says `text`.
NSErrorRef socketError(int number, const std::string& path, std::string text) {
  return NSError::errorWithDomain(
      NSPOSIXErrorDomain, number,
      {{NSLocalizedDescriptionKey, std::move(text)}, {NSFilePathErrorKey, path}});
}

NSErrorRef directoryError(int number, const std::string& directory) {
  if (isDescriptorShortage(number)) {
    return socketError(number, directory,
                       "The socket directory " + directory +
                           " cannot be opened: " + std::strerror(number) +
                           ". Raise the limit on open files, or close some.");
  }
  return socketError(
      number, directory,
      "The socket directory " + directory + " cannot be used: " + std::strerror(number) + ".");
}

/// The address of a path of any length: a socket address holds 107 bytes, so that a path is named
/// by its directory's descriptor where it would not fit.
class SocketAddress {
 public:
  static std::optional<SocketAddress> make(const std::string& path, NSErrorRef* error) {
    SocketAddress result;
    const auto slash = path.rfind('/');
    if (path.find('\0') != std::string::npos || slash == std::string::npos ||
        slash + 1 == path.size()) {
      storeError(error, socketError(EINVAL, path, "'" + path + "' is no path for a socket."));
      return std::nullopt;
    }
    result.directoryPath_ = slash == 0 ? "/" : path.substr(0, slash);
    result.directory_ =
        UniqueFd(::open(result.directoryPath_.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!result.directory_) {
      storeError(error, directoryError(errno, result.directoryPath_));
      return std::nullopt;
    }
    result.name_ = path.substr(slash + 1);
    std::string text = path;
    if (text.size() >= sizeof result.address_.sun_path) {
      text = pathOfDescriptor(result.directory_.get()) + "/" + result.name_;
    }
    if (text.size() >= sizeof result.address_.sun_path) {
      storeError(error, socketError(ENAMETOOLONG, path,
                                    "The socket's name is too long: " + result.name_ + "."));
      return std::nullopt;
    }
    std::memcpy(result.address_.sun_path, text.c_str(), text.size() + 1);
    return result;
  }

  [[nodiscard]] int connect(int fd) const {
    int result = -1;
    do {
      result = ::connect(fd, pointer(), sizeof address_);
    } while (result != 0 && errno == EINTR);
    return result;
  }
  [[nodiscard]] int bind(int fd) const { return ::bind(fd, pointer(), sizeof address_); }
  [[nodiscard]] int directory() const { return directory_.get(); }
  [[nodiscard]] const std::string& directoryPath() const { return directoryPath_; }
  [[nodiscard]] const char* name() const { return name_.c_str(); }

 private:
  [[nodiscard]] const sockaddr* pointer() const {
    return reinterpret_cast<const sockaddr*>(&address_);
  }

  sockaddr_un address_{.sun_family = AF_UNIX, .sun_path = {}};
  UniqueFd directory_;
  std::string directoryPath_;
  std::string name_;
};

UniqueFd makeSocket(const std::string& path, NSErrorRef* error) {
  UniqueFd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  if (!fd) {
    storeError(error, socketError(errno, path,
                                  std::string("No socket can be made: ") + std::strerror(errno) +
                                      ". Raise the limit on open files, or close some."));
  }
  return fd;
}

NSErrorRef connectError(int number, const std::string& path) {
  const std::string at = " at " + path;
  switch (number) {
    case ENOENT:
    case ECONNREFUSED:
      return socketError(
          number, path,
          "Nothing is listening" + at + ". Start the drive with `yomber up` and try again.");
    case EAGAIN:
      return socketError(number, path,
                         "The process listening" + at +
                             " does not accept connections; it is stopped or too busy. Try again, "
                             "or restart it.");
    case EACCES:
    case EPERM:
      return socketError(
          number, path,
          "The socket" + at + " belongs to another user. Use a drive home of your own.");
    default:
      return socketError(
          number, path,
          "Connecting to the socket" + at + " failed: " + std::strerror(number) + ".");
  }
}

/// Sees that the name is free to bind: removes a socket that nobody answers on.
bool clearName(const SocketAddress& address, const std::string& path, NSErrorRef* error) {
  struct stat status{};
  if (::fstatat(address.directory(), address.name(), &status, AT_SYMLINK_NOFOLLOW) != 0) {
    if (errno == ENOENT) return true;
    storeError(error, directoryError(errno, address.directoryPath()));
    return false;
  }
  if (!S_ISSOCK(status.st_mode)) {
    storeError(error, socketError(EEXIST, path,
                                  "Something that is no socket is in the way at " + path +
                                      ". Move it elsewhere and try again."));
    return false;
  }
  UniqueFd probe = makeSocket(path, error);
  if (!probe) return false;
  ::fcntl(probe.get(), F_SETFL, O_NONBLOCK);
  // A full queue (EAGAIN) is somebody's, too.
  if (address.connect(probe.get()) == 0 || errno != ECONNREFUSED) {
    storeError(error, socketError(EADDRINUSE, path,
                                  "It is already running: a process answers at " + path +
                                      ". Stop that one first, or use another home."));
    return false;
  }
  if (::unlinkat(address.directory(), address.name(), 0) == 0 || errno == ENOENT) return true;
  storeError(error, directoryError(errno, address.directoryPath()));
  return false;
}

}  // namespace

void UniqueFd::reset(int fd) {
  if (fd_ >= 0) ::close(fd_);
  fd_ = fd;
}

UniqueFd duplicateDescriptor(int fd, NSErrorRef* error) {
  UniqueFd result(::fcntl(fd, F_DUPFD_CLOEXEC, 3));
  if (!result) storeError(error, NSError::errorWithErrno(errno));
  return result;
}

bool makeSocketPair(UniqueFd& first, UniqueFd& second, NSErrorRef* error) {
  int ends[2] = {-1, -1};
  if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends) != 0) {
    storeError(error, NSError::errorWithErrno(errno));
    return false;
  }
  first.reset(ends[0]);
  second.reset(ends[1]);
  return true;
}

std::optional<PeerCredentials> peerCredentials(int fd) {
  ucred credentials{};
  socklen_t length = sizeof credentials;
  if (::getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &credentials, &length) != 0) return std::nullopt;
  return PeerCredentials{credentials.pid, credentials.uid, credentials.gid};
}

bool isDescriptorShortage(int number) {
  return number == EMFILE || number == ENFILE || number == ENOBUFS || number == ENOMEM;
}

UniqueFd connectUnixSocket(const std::string& path, NSErrorRef* error) {
  NSErrorRef unusable;
  const auto address = SocketAddress::make(path, &unusable);
  if (!address) {
    const bool isMissing =
        unusable->is(NSPOSIXErrorDomain, ENOENT) || unusable->is(NSPOSIXErrorDomain, ENOTDIR);
    storeError(error, isMissing ? connectError(ENOENT, path) : unusable);
    return {};
  }
  UniqueFd fd = makeSocket(path, error);
  if (!fd) return {};
  const timeval patience{.tv_sec = kConnectSeconds, .tv_usec = 0};
  ::setsockopt(fd.get(), SOL_SOCKET, SO_SNDTIMEO, &patience, sizeof patience);
  if (address->connect(fd.get()) != 0) {
    storeError(error, connectError(errno, path));
    return {};
  }
  const auto peer = peerCredentials(fd.get());
  if (!peer || peer->uid != ::geteuid()) {
    storeError(error, connectError(EPERM, path));
    return {};
  }
  return fd;
}

UniqueFd listenUnixSocket(const std::string& path, NSErrorRef* error) {
  const auto address = SocketAddress::make(path, error);
  if (!address) return {};
  // Two that start at the same time must not take each other's new socket for a stale one.
  if (::flock(address->directory(), LOCK_EX) != 0) {
    storeError(error, directoryError(errno, address->directoryPath()));
    return {};
  }
  if (!clearName(*address, path, error)) return {};
  UniqueFd fd = makeSocket(path, error);
  if (!fd) return {};
  // Before the name exists, so that it never has a wider mode.
  ::fchmod(fd.get(), 0600);
  if (address->bind(fd.get()) != 0 || ::listen(fd.get(), kBacklog) != 0) {
    storeError(error, directoryError(errno, address->directoryPath()));
    return {};
  }
  ::fcntl(fd.get(), F_SETFL, O_NONBLOCK);
  return fd;
}

}  // namespace yomber::ipc
