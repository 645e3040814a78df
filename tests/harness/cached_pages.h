#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include <fcntl.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace yomber::testing {

/// Pages of a part of a file that are not on the disk yet; nothing where the system does not tell.
inline std::optional<std::uint64_t> unwrittenPages(const std::string& path, off_t offset,
                                                   std::size_t length) {
  constexpr long kCachestat = 451;
  struct {
    std::uint64_t offset, length;
  } range{static_cast<std::uint64_t>(offset), length};
  struct {
    std::uint64_t cached = 0, dirty = 0, inWriteback = 0, evicted = 0, recentlyEvicted = 0;
  } pages;
  const int file = open(path.c_str(), O_RDONLY | O_CLOEXEC);
  const long failure = syscall(kCachestat, file, &range, &pages, 0);
  if (file >= 0) close(file);
  if (failure != 0) return std::nullopt;
  return pages.dirty + pages.inWriteback;
}

}  // namespace yomber::testing
