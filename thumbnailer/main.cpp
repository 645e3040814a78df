#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdint>
#include <cstring>
#include <string>

#include "platform/drawing/drawing_protocol.h"
#include "thumbnailer/picture.h"
#include "thumbnailer/sandbox.h"

namespace yomber::thumbnailer {
namespace {

constexpr std::uint64_t kMemory = std::uint64_t{2} << 30;
constexpr std::uint64_t kFileSize = std::uint64_t{16} << 20;
constexpr int kIdle = 30'000;  // ms without a request, after which the process ends
constexpr int kLargestSide = 4096;

/// The two descriptors of a request; closed with it.
struct Files {
  std::array<int, 2> descriptors{-1, -1};
  Files() = default;
  Files(const Files&) = delete;
  Files& operator=(const Files&) = delete;
  ~Files() {
    for (const int descriptor : descriptors)
      if (descriptor >= 0) close(descriptor);
  }
};

/// False at the end: nobody is there any more, or nobody has asked for long.
bool awaitRequest() {
  pollfd polled{.fd = drawing::kSocket, .events = POLLIN, .revents = 0};
  int count = 0;
  do {
    count = poll(&polled, 1, kIdle);
  } while (count < 0 && errno == EINTR);
  return count > 0;
}

/// False for what is no request.
bool receive(drawing::Request& request, Files& files) {
  iovec part{.iov_base = &request, .iov_len = sizeof request};
  alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof files.descriptors)> control{};
  msghdr message{};
  message.msg_iov = &part;
  message.msg_iovlen = 1;
  message.msg_control = control.data();
  message.msg_controllen = control.size();
  const ssize_t length = recvmsg(drawing::kSocket, &message, MSG_CMSG_CLOEXEC);
  if (length != static_cast<ssize_t>(sizeof request)) return false;
  const cmsghdr* const header = CMSG_FIRSTHDR(&message);
  if (header == nullptr || header->cmsg_level != SOL_SOCKET || header->cmsg_type != SCM_RIGHTS ||
      header->cmsg_len != CMSG_LEN(sizeof files.descriptors))
    return false;
  std::memcpy(files.descriptors.data(), CMSG_DATA(header), sizeof files.descriptors);
  return request.magic == drawing::kMagic && request.side > 0 && request.side <= kLargestSide;
}

bool answerOne() {
  drawing::Request request;
  Files files;
  if (!receive(request, files)) return false;
  limitProcessor(request.processorSeconds);
  const drawing::Reply reply = draw(request, files.descriptors[0], files.descriptors[1]);
  return send(drawing::kSocket, &reply, sizeof reply, MSG_NOSIGNAL) ==
         static_cast<ssize_t>(sizeof reply);
}

[[noreturn]] void refuse(const std::string& reason) {
  const std::string line = "yomber-thumbnailer: " + reason + "\n";
  (void)!write(STDERR_FILENO, line.data(), line.size());
  _exit(1);
}

[[noreturn]] void run() {
  int type = 0;
  socklen_t length = sizeof type;
  if (getsockopt(drawing::kSocket, SOL_SOCKET, SO_TYPE, &type, &length) != 0)
    refuse("started by the drive's programs when they need it, not by hand");
  if (const std::string failure = limitRights(kMemory, kFileSize); !failure.empty())
    refuse("cannot give up its rights: " + failure);
  if (!prepare()) refuse("libvips cannot be used");
  warmUp();
  if (const std::string failure = closeDoors(); !failure.empty())
    refuse("cannot give up its rights: " + failure);
  while (awaitRequest() && answerOne()) {
  }
  _exit(0);  // with nothing to tidy up
}

}  // namespace
}  // namespace yomber::thumbnailer

int main() { yomber::thumbnailer::run(); }
