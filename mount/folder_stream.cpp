#include "mount/folder_stream.h"

#include <dirent.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <string_view>

namespace yomber {
namespace {

constexpr std::size_t kBufferBytes = 64 << 10;
/// Where what is no entry on the disk begins: behind all positions that file systems give but that
/// of the end, which may be the largest of all (ext4, btrfs).
constexpr off_t kShownPosition = 0x7fff'ffff'ffff'0000;

/// What getdents64 writes.
struct DiskEntry {
  std::uint64_t inode;
  std::int64_t next;
  std::uint16_t length;
  std::uint8_t type;
};
constexpr std::size_t kNameOffset = 19;

}  // namespace

int FolderStream::seek(off_t position) {
  if (position == position_ && position != 0) return 0;
  position_ = position;
  used_ = filled_ = 0;
  isBehindDisk_ = position >= kShownPosition;
  if (isBehindDisk_) return 0;
  return lseek(folder_.get(), position, SEEK_SET) < 0 ? errno : 0;
}

int FolderStream::look(Entry& entry) {
  entry = {};
  if (!isBehindDisk_ && used_ == filled_) {
    buffer_.resize(kBufferBytes);
    const long count = syscall(SYS_getdents64, folder_.get(), buffer_.data(), buffer_.size());
    if (count < 0) return errno == ENOENT ? 0 : errno;  // a removed folder has none
    used_ = 0;
    filled_ = static_cast<std::size_t>(count);
    isBehindDisk_ = count == 0;
    if (isBehindDisk_) position_ = kShownPosition;
  }
  if (isBehindDisk_) {
    const auto index = static_cast<std::size_t>(position_ - kShownPosition);
    if (index >= shown_.size()) return 0;
    entry.shown = &shown_[index];
    entry.name = entry.shown->name.c_str();
    entry.type = DT_DIR;
    entry.next = position_ + 1;
    return 0;
  }
  DiskEntry found{};
  std::memcpy(&found, buffer_.data() + used_, kNameOffset);
  entry.name = buffer_.data() + used_ + kNameOffset;
  entry.inode = found.inode;
  entry.type = found.type;
  entry.next = std::min<off_t>(found.next, kShownPosition);
  return 0;
}

void FolderStream::take(const Entry& entry) {
  position_ = entry.next;
  if (isBehindDisk_) return;
  DiskEntry taken{};
  std::memcpy(&taken, buffer_.data() + used_, kNameOffset);
  used_ += taken.length;
}

}  // namespace yomber
