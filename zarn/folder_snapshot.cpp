#include "zarn/folder_snapshot.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstddef>
#include <limits>

#include "platform/foundation/file_time.h"
#include "platform/foundation/unnoticed_reads.h"
#include "zarn/change_times.h"
#include "zarn/tree_layout.h"

namespace yomber {
namespace {

constexpr std::size_t kReadBuffer = 128 * 1024;

std::int64_t nanoseconds(const statx_timestamp& time) {
  return nanosecondsOf(time.tv_sec, time.tv_nsec);
}

bool typeOf(std::uint32_t mode, EntryType& type) {
  if (S_ISREG(mode)) {
    type = EntryType::File;
  } else if (S_ISDIR(mode)) {
    type = EntryType::Folder;
  } else if (S_ISLNK(mode)) {
    type = EntryType::Symlink;
  } else {
    return false;
  }
  return true;
}

bool isOtherKind(unsigned char type) {
  return type == DT_FIFO || type == DT_SOCK || type == DT_CHR || type == DT_BLK;
}

void addEntry(int folder, const char* name, FolderSnapshot& snapshot) {
  const std::string_view text(name);
  if (text == "." || text == ".." || isExcludedName(text)) return;
  FolderEntry entry;
  if (!lookAtEntry(folder, name, entry)) {
    if (errno != ENOENT && errno != EINVAL) snapshot.isPartial = true;
    return;
  }
  entry.nameOffset = static_cast<std::uint32_t>(snapshot.names.size());
  entry.nameLength = static_cast<std::uint16_t>(text.size());
  snapshot.names.append(text);
  snapshot.entries.push_back(entry);
}

}  // namespace

const ItemAttributes& FolderSnapshot::attributesOf(std::size_t entry) const {
  static const ItemAttributes none;
  const auto found = std::lower_bound(
      attributes.begin(), attributes.end(), entry,
      [](const auto& element, std::size_t index) { return element.first < index; });
  return found != attributes.end() && found->first == entry ? found->second : none;
}

bool lookAtEntry(int folder, const char* name, FolderEntry& out) {
  constexpr unsigned kWanted = STATX_TYPE | STATX_MODE | STATX_NLINK | STATX_INO | STATX_SIZE |
                               STATX_MTIME | STATX_CTIME | STATX_BTIME;
  struct statx status;
  const int flags = AT_SYMLINK_NOFOLLOW | AT_NO_AUTOMOUNT | AT_STATX_DONT_SYNC |
                    (*name == '\0' ? AT_EMPTY_PATH : 0);
  const std::int64_t before = coarseNow();
  if (statx(folder, name, flags, kWanted, &status) != 0) return false;
  const std::int64_t after = coarseNow();
  const bool isMountRoot = (status.stx_attributes & STATX_ATTR_MOUNT_ROOT) != 0;
  // What is mounted inside the tree is not of the tree.
  if (!typeOf(status.stx_mode, out.type) || (isMountRoot && *name != '\0')) {
    errno = EINVAL;
    return false;
  }
  out.mode = status.stx_mode;
  out.links = status.stx_nlink;
  out.inode = status.stx_ino;
  out.size = out.type == EntryType::Folder ? 0 : status.stx_size;
  out.mtime = nanoseconds(status.stx_mtime);
  out.ctime = nanoseconds(status.stx_ctime);
  out.isSettled = isSettledTime(out.ctime, before, after);
  out.hasBirthTime = (status.stx_mask & STATX_BTIME) != 0;
  out.btime = out.hasBirthTime ? nanoseconds(status.stx_btime) : out.mtime;
  return true;
}

int readFolderEntries(int folder, FolderSnapshot& snapshot) {
  alignas(dirent64) thread_local std::array<char, kReadBuffer> buffer;
  readUnnoticed(folder);
  for (;;) {
    const ssize_t length = getdents64(folder, buffer.data(), buffer.size());
    if (length < 0) return errno;
    if (length == 0) return 0;
    for (ssize_t at = 0; at < length;) {
      const auto* const record = reinterpret_cast<const dirent64*>(buffer.data() + at);
      if (!isOtherKind(record->d_type)) addEntry(folder, record->d_name, snapshot);
      at += record->d_reclen;
    }
  }
}

}  // namespace yomber
