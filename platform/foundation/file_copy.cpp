#include "platform/foundation/file_copy.h"

#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <string>
#include <vector>

namespace yomber {
namespace {

constexpr std::size_t kBufferSize = std::size_t{1} << 20U;

bool isUnsupported(int number) {
  return number == EXDEV || number == EINVAL || number == ENOSYS || number == EOPNOTSUPP ||
         number == EBADF;
}

/// Through memory, for file systems between which the kernel copies nothing.
int copyThroughMemory(int source, int destination, off_t from, off_t to) {
  std::vector<char> buffer(kBufferSize);
  while (from < to) {
    const auto wanted = std::min(buffer.size(), static_cast<std::size_t>(to - from));
    const ssize_t got = pread(source, buffer.data(), wanted, from);
    if (got < 0 && errno == EINTR) continue;
    if (got < 0) return errno;
    if (got == 0) return 0;
    for (ssize_t written = 0; written < got;) {
      const ssize_t put = pwrite(destination, buffer.data() + written,
                                 static_cast<std::size_t>(got - written), from + written);
      if (put < 0 && errno != EINTR) return errno;
      written += std::max<ssize_t>(put, 0);
    }
    from += got;
  }
  return 0;
}

int copyRange(int source, int destination, off_t from, off_t to) {
  while (from < to) {
    off_t out = from;
    const ssize_t copied =
        copy_file_range(source, &from, destination, &out, static_cast<std::size_t>(to - from), 0);
    if (copied == 0) return 0;
    if (copied > 0 || errno == EINTR) continue;
    if (!isUnsupported(errno)) return errno;
    return copyThroughMemory(source, destination, from, to);
  }
  return 0;
}

/// Where the data at or after `from` begins and ends; a file system that knows no holes has data
/// everywhere. An empty range: no more data. Negative: errno.
struct Range {
  off_t begin = 0;
  off_t end = 0;
};
Range nextData(int source, off_t from, off_t size) {
  Range data;
  data.begin = lseek(source, from, SEEK_DATA);
  if (data.begin < 0) return errno == ENXIO ? Range{size, size} : Range{from, size};
  data.end = lseek(source, data.begin, SEEK_HOLE);
  if (data.end < 0 || data.end > size) data.end = size;
  return data;
}

}  // namespace

int copyFileContent(int source, int destination) {
  struct stat status{};
  if (fstat(source, &status) != 0) return errno;
  if (status.st_size == 0) return 0;
  if (ioctl(destination, FICLONE, source) == 0) return 0;
  for (off_t at = 0; at < status.st_size;) {
    const Range data = nextData(source, at, status.st_size);
    if (data.begin >= data.end) break;
    const int failure = copyRange(source, destination, data.begin, data.end);
    if (failure != 0) return failure;
    at = data.end;
  }
  // A source that shrank leaves no zeros behind that it never had.
  struct stat now{};
  if (fstat(source, &now) != 0) return errno;
  return ftruncate(destination, std::min(status.st_size, now.st_size)) == 0 ? 0 : errno;
}

int copyUserAttributes(int source, int destination,
                       const std::function<bool(std::string_view name)>& isWanted) {
  std::string names;
  ssize_t length = flistxattr(source, nullptr, 0);
  while (length > 0) {
    names.resize(static_cast<std::size_t>(length));
    length = flistxattr(source, names.data(), names.size());
    if (length >= 0) break;
    if (errno != ERANGE) return errno;
    length = flistxattr(source, nullptr, 0);
  }
  if (length < 0) return errno == EOPNOTSUPP ? 0 : errno;
  names.resize(static_cast<std::size_t>(length));
  std::string value;
  for (std::size_t at = 0; at < names.size();) {
    const char* const name = names.c_str() + at;
    const std::string_view view(name);
    at += view.size() + 1;
    if (!view.starts_with("user.") || !isWanted(view)) continue;
    constexpr std::size_t kLargestAttribute = 65'536;
    value.resize(kLargestAttribute);
    const ssize_t size = fgetxattr(source, name, value.data(), value.size());
    if (size < 0 && errno == ENODATA) continue;
    if (size < 0) return errno;
    const auto bytes = static_cast<std::size_t>(size);
    if (fsetxattr(destination, name, value.data(), bytes, 0) != 0) return errno;
  }
  return 0;
}

}  // namespace yomber
