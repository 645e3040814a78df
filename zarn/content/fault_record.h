#pragma once

#include <sys/stat.h>

#include <cstdint>
#include <string>

#include "platform/foundation/fault_attributes.h"
#include "platform/ostrell/fault_record.h"

namespace yomber {

/// Which file, and as which it was when it was looked at.
struct FileStamp {
  std::uint64_t inode = 0;
  std::uint64_t size = 0;
  std::int64_t mtime = 0;  ///< ns since the epoch
  std::int64_t ctime = 0;  ///< ns

  static FileStamp of(const struct stat& status);
  /// Apart from the ctime, which changes with names and attributes too.
  [[nodiscard]] bool hasSameContent(const FileStamp& other) const {
    return inode == other.inode && size == other.size && mtime == other.mtime;
  }
  friend bool operator==(const FileStamp&, const FileStamp&) = default;
};

/// Of an open file; all zero when it cannot be looked at.
[[nodiscard]] FileStamp stampOf(int file);
/// Of what lies there, a link itself; all zero when that is nothing.
[[nodiscard]] FileStamp stampAt(const std::string& path);

/// The stamp of an open file, and whether a change that comes after the look is sure to show in it.
struct StampedLook {
  FileStamp stamp;  ///< all zero when the file cannot be looked at
  bool isSettled = true;

  /// What to remember of it: where it is not settled, one that the file never has.
  [[nodiscard]] FileStamp toRemember() const {
    FileStamp result = stamp;
    if (!isSettled) --result.ctime;
    return result;
  }
};
[[nodiscard]] StampedLook lookAtStamp(int file);

}  // namespace yomber
