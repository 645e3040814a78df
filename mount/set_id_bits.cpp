#include "mount/set_id_bits.h"

#include <unistd.h>

#include <algorithm>
#include <cstddef>
#include <vector>

namespace yomber {
namespace {

bool isInGroup(fuse_req_t request, gid_t group) {
  if (fuse_req_ctx(request)->gid == group) return true;
  std::vector<gid_t> groups(64);
  for (;;) {
    const int count = fuse_req_getgroups(request, static_cast<int>(groups.size()), groups.data());
    if (count < 0) return false;
    const bool areAll = static_cast<std::size_t>(count) <= groups.size();
    groups.resize(static_cast<std::size_t>(count));
    if (areAll) return std::ranges::find(groups, group) != groups.end();
  }
}

}  // namespace

mode_t setIDToTake(fuse_req_t request, const struct stat& status) {
  if (geteuid() != 0 || fuse_req_ctx(request)->uid == 0) return 0;
  const mode_t bits = status.st_mode & (S_ISUID | S_ISGID);
  const bool isHarmless = (bits & S_ISGID) != 0 && (status.st_mode & S_IXGRP) == 0;
  return isHarmless && isInGroup(request, status.st_gid) ? bits & S_ISUID : bits;
}

void takeSetIDAway(fuse_req_t request, int file) {
  struct stat status{};
  const mode_t taken = fstat(file, &status) == 0 ? setIDToTake(request, status) : 0;
  if (taken != 0) (void)fchmod(file, status.st_mode & ALLPERMS & ~taken);
}

}  // namespace yomber
