#include "platform/drawing/drawing_process.h"

#include <sys/socket.h>

#include <array>
#include <cerrno>
#include <cstring>
#include <string>
#include <vector>

#include "platform/drawing/waiting.h"

namespace yomber {
namespace {

/// No proxies of other processes, no settings, no caches: nothing of it is asked for.
const std::vector<std::string>& environmentOfDrawing() {
  static const std::vector<std::string> all{"LANG=C.UTF-8", "VIPS_WARNING=0", "MALLOC_ARENA_MAX=2",
                                            "GIO_USE_VFS=local", "GSETTINGS_BACKEND=memory"};
  return all;
}

}  // namespace

NSErrorRef DrawingProcess::start(const std::string& program) {
  std::array<int, 2> pair{};
  if (socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, pair.data()) != 0)
    return NSError::errorWithErrno(errno);
  socket_ = FileDescriptor(pair[0]);
  const FileDescriptor theirs(pair[1]);
  // It ends when its socket is closed.
  const int number =
      process_.start({program}, environmentOfDrawing(), theirs.get(), drawing::kSocket);
  if (number == 0) return nullptr;
  return NSError::errorWithDomain(
      NSPOSIXErrorDomain, number,
      {{NSFilePathErrorKey, program},
       {NSLocalizedDescriptionKey, "no picture can be drawn: cannot start " + program + ": " +
                                       std::strerror(number) + "; install it there"}});
}

bool DrawingProcess::send(const drawing::Request& request, int input, int output) {
  iovec part{.iov_base = const_cast<drawing::Request*>(&request), .iov_len = sizeof request};
  const std::array<int, 2> descriptors{input, output};
  alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof descriptors)> control{};
  msghdr message{};
  message.msg_iov = &part;
  message.msg_iovlen = 1;
  message.msg_control = control.data();
  message.msg_controllen = control.size();
  cmsghdr* const header = CMSG_FIRSTHDR(&message);
  header->cmsg_level = SOL_SOCKET;
  header->cmsg_type = SCM_RIGHTS;
  header->cmsg_len = CMSG_LEN(sizeof descriptors);
  std::memcpy(CMSG_DATA(header), descriptors.data(), sizeof descriptors);
  ssize_t sent = -1;
  do {
    sent = sendmsg(socket_.get(), &message, MSG_NOSIGNAL);
  } while (sent < 0 && errno == EINTR);
  return sent == static_cast<ssize_t>(sizeof request);
}

NSErrorRef DrawingProcess::receive(drawing::Reply& reply, std::chrono::milliseconds patience) {
  if (!waitReadable(socket_.get(), std::chrono::steady_clock::now() + patience)) {
    (void)end();
    return NSError::errorWithErrno(ETIME);
  }
  const ssize_t length = recv(socket_.get(), &reply, sizeof reply, MSG_DONTWAIT | MSG_TRUNC);
  if (length == static_cast<ssize_t>(sizeof reply) && reply.magic == drawing::kMagic)
    return nullptr;
  if (length > 0) return NSError::errorWithErrno(EPROTO);
  return end();  // it has closed the socket, as it ends or pretends to
}

NSErrorRef DrawingProcess::end() {
  process_.kill();
  process_.reap();
  const bool hasRefused = process_.exitCode() && *process_.exitCode() != 0;
  return NSError::errorWithErrno(hasRefused ? ENOEXEC : EIO);
}

}  // namespace yomber
