#include "zarn/content/fault_record.h"

#include <sys/stat.h>
#include <sys/xattr.h>

#include <array>
#include <cerrno>

#include "platform/foundation/fault_attributes.h"
#include "platform/foundation/file_time.h"
#include "zarn/change_times.h"

namespace yomber {
FileStamp FileStamp::of(const struct stat& status) {
  return {.inode = status.st_ino,
          .size = static_cast<std::uint64_t>(status.st_size),
          .mtime = nanosecondsOf(status.st_mtim),
          .ctime = nanosecondsOf(status.st_ctim)};
}

StampedLook lookAtStamp(int file) {
  struct stat status{};
  const std::int64_t before = coarseNow();
  if (fstat(file, &status) != 0) return {};
  const std::int64_t after = coarseNow();
  const FileStamp stamp = FileStamp::of(status);
  return {stamp, isSettledTime(stamp.ctime, before, after)};
}

bool isFilledInThisBoot(int file) {
  std::array<char, 64> boot{};
  const ssize_t length = fgetxattr(file, kFilledAttribute, boot.data(), boot.size());
  if (length <= 0 || bootIdentifier().empty()) return false;
  return std::string_view(boot.data(), static_cast<std::size_t>(length)) == bootIdentifier();
}

bool isUnfilledFault(int file) {
  return fgetxattr(file, kFaultAttribute, nullptr, 0) >= 0 && !isFilledInThisBoot(file);
}

}  // namespace yomber
