#include "zarn/content/fault_record.h"

#include <sys/stat.h>

#include "platform/foundation/file_time.h"
#include "zarn/change_times.h"

namespace yomber {

FileStamp FileStamp::of(const struct stat& status) {
  return {.inode = status.st_ino,
          .size = static_cast<std::uint64_t>(status.st_size),
          .mtime = nanosecondsOf(status.st_mtim),
          .ctime = nanosecondsOf(status.st_ctim)};
}

FileStamp stampOf(int file) {
  struct stat status{};
  return fstat(file, &status) == 0 ? FileStamp::of(status) : FileStamp{};
}

FileStamp stampAt(const std::string& path) {
  struct stat status{};
  return lstat(path.c_str(), &status) == 0 ? FileStamp::of(status) : FileStamp{};
}

StampedLook lookAtStamp(int file) {
  struct stat status{};
  const std::int64_t before = coarseNow();
  if (fstat(file, &status) != 0) return {};
  const std::int64_t after = coarseNow();
  const FileStamp stamp = FileStamp::of(status);
  return {stamp, isSettledTime(stamp.ctime, before, after)};
}

}  // namespace yomber
