#include "zarn/content/file_lease.h"

#include <fcntl.h>

#include <csignal>
#include <utility>

namespace yomber {

FileLease::FileLease(int file) : file_(file) {
  // Whoever wants the file has the system signal us. Ours to notice is by asking; the signal is one
  // that does nothing.
  (void)fcntl(file, F_SETSIG, SIGURG);
  if (fcntl(file, F_SETLEASE, F_WRLCK) != 0) file_ = -1;
}

bool FileLease::isHeld() const { return file_ >= 0 && fcntl(file_, F_GETLEASE) == F_WRLCK; }

void FileLease::release() {
  const int file = std::exchange(file_, -1);
  if (file >= 0) (void)fcntl(file, F_SETLEASE, F_UNLCK);
}

}  // namespace yomber
