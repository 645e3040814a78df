#pragma once

#include <sys/stat.h>

#include <cstdint>

#include "platform/foundation/file_time.h"

namespace yomber {

inline std::int64_t nanoseconds(const statx_timestamp& time) {
  return nanosecondsOf({.tv_sec = time.tv_sec, .tv_nsec = time.tv_nsec});
}

/// What makes a file the same one. Inode numbers are given again; a file that was made later is
/// another one.
struct FileIdentity {
  std::uint64_t inode = 0;
  std::int64_t born = 0;  ///< ns since the epoch; 0 where the file system does not tell

  static FileIdentity of(const struct statx& status) {
    const bool isKnown = (status.stx_mask & STATX_BTIME) != 0;
    return {status.stx_ino, isKnown ? nanoseconds(status.stx_btime) : 0};
  }
  friend bool operator==(const FileIdentity&, const FileIdentity&) = default;
};

/// What st_blocks counts.
inline constexpr std::uint64_t kBlockBytes = 512;

/// Content that is away is a hole behind its first block.
inline bool mayHaveHoles(const struct statx& status) {
  return S_ISREG(status.stx_mode) && status.stx_blocks * kBlockBytes < status.stx_size;
}

/// What `statx` is asked for.
inline constexpr unsigned kWantedStatus = STATX_BASIC_STATS | STATX_BTIME;

/// 0 or an errno. A final symbolic link is looked at itself; an empty name means `folder`.
[[nodiscard]] int lookAt(int folder, const char* name, struct statx& status);

/// As the kernel wants it.
[[nodiscard]] struct stat statOf(const struct statx& status);

}  // namespace yomber
