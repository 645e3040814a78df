#include "mount/file_identity.h"

#include <fcntl.h>
#include <sys/sysmacros.h>

#include <cerrno>

namespace yomber {
namespace {

/// As much as whoever lists a folder is advised to read at once, bytes: each time, the kernel asks
/// us. The C library follows the advice.
constexpr blksize_t kFolderReading = 128 << 10;

}  // namespace

int lookAt(int folder, const char* name, struct statx& status) {
  const int flags = AT_SYMLINK_NOFOLLOW | AT_NO_AUTOMOUNT | (*name == 0 ? AT_EMPTY_PATH : 0);
  return statx(folder, name, flags, kWantedStatus, &status) == 0 ? 0 : errno;
}

struct stat statOf(const struct statx& status) {
  const auto time = [](const statx_timestamp& from) {
    return timespec{.tv_sec = from.tv_sec, .tv_nsec = static_cast<long>(from.tv_nsec)};
  };
  struct stat result{};
  result.st_ino = status.stx_ino;
  result.st_mode = status.stx_mode;
  result.st_nlink = status.stx_nlink;
  result.st_uid = status.stx_uid;
  result.st_gid = status.stx_gid;
  result.st_rdev = makedev(status.stx_rdev_major, status.stx_rdev_minor);
  result.st_size = static_cast<off_t>(status.stx_size);
  result.st_blksize = S_ISDIR(status.stx_mode) ? kFolderReading : status.stx_blksize;
  result.st_blocks = static_cast<blkcnt_t>(status.stx_blocks);
  result.st_atim = time(status.stx_atime);
  result.st_mtim = time(status.stx_mtime);
  result.st_ctim = time(status.stx_ctime);
  return result;
}

}  // namespace yomber
