#include "zarn/content/file_lease.h"

#include <fcntl.h>

#include <cerrno>
#include <csignal>
#include <fstream>
#include <utility>

#include "platform/foundation/file_descriptor.h"

namespace yomber {
namespace {

bool takeLease(int file, int kind) {
  // Whoever wants the file has the system signal us. Ours to notice is by asking; the signal is one
  // that does nothing.
  (void)fcntl(file, F_SETSIG, SIGURG);
  return fcntl(file, F_SETLEASE, kind) == 0;
}

}  // namespace

FileLease::FileLease(int file) : file_(takeLease(file, F_WRLCK) ? file : -1) {}

FileLease::State FileLease::state() const {
  if (file_ < 0) return State::Lost;
  switch (fcntl(file_, F_GETLEASE)) {
    case F_WRLCK:
      return State::Held;
    case F_RDLCK:
      return State::WantedToRead;
    default:
      return State::Lost;
  }
}

void FileLease::release() {
  const int file = std::exchange(file_, -1);
  if (file >= 0) (void)fcntl(file, F_SETLEASE, F_UNLCK);
}

std::chrono::milliseconds FileLease::longestWait() {
  static const std::chrono::seconds kUsual{45};
  int seconds = 0;
  std::ifstream("/proc/sys/fs/lease-break-time") >> seconds;
  return seconds > 0 ? std::chrono::seconds(seconds) : kUsual;
}

bool isOpenForWriting(const std::string& path) {
  constexpr int kOpening = O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC | O_NOCTTY;
  const FileDescriptor file(open(path.c_str(), kOpening));
  if (!file) return false;
  // Readers do not hinder a lease of that kind.
  if (!takeLease(file.get(), F_RDLCK)) return errno == EAGAIN;
  (void)fcntl(file.get(), F_SETLEASE, F_UNLCK);
  return false;
}

}  // namespace yomber
