#include "platform/foundation/whole_transfer.h"

#include <unistd.h>

#include <cerrno>

namespace yomber {

int readWhole(int file, std::span<char> bytes, std::uint64_t offset, std::size_t& done) {
  done = 0;
  while (done < bytes.size()) {
    const ssize_t count =
        pread(file, bytes.data() + done, bytes.size() - done, static_cast<off_t>(offset + done));
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return errno;
    if (count == 0) break;
    done += static_cast<std::size_t>(count);
  }
  return 0;
}

int writeWhole(int file, std::string_view bytes, std::uint64_t offset) {
  while (!bytes.empty()) {
    const ssize_t count = pwrite(file, bytes.data(), bytes.size(), static_cast<off_t>(offset));
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return errno;
    bytes.remove_prefix(static_cast<std::size_t>(count));
    offset += static_cast<std::uint64_t>(count);
  }
  return 0;
}

}  // namespace yomber
