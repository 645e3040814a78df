#include "mount/set_id_bits.h"

#include <unistd.h>

#include <algorithm>
#include <fstream>
#include <iterator>
#include <sstream>
#include <string>
#include <string_view>

namespace yomber {
namespace {

// Asked of /proc here, since libfuse's fuse_req_getgroups() searches past the end of what it reads.
bool hasSupplementaryGroup(pid_t thread, gid_t group) {
  constexpr std::string_view kGroups = "Groups:";
  std::ifstream status("/proc/" + std::to_string(thread) + "/status");
  for (std::string line; std::getline(status, line);) {
    if (!line.starts_with(kGroups)) continue;
    std::istringstream groups(line.substr(kGroups.size()));
    const std::istream_iterator<gid_t> end;
    return std::find(std::istream_iterator<gid_t>(groups), end, group) != end;
  }
  return false;
}

bool isInGroup(const fuse_ctx& caller, gid_t group) {
  return caller.gid == group || hasSupplementaryGroup(caller.pid, group);
}

}  // namespace

mode_t setIDToTake(fuse_req_t request, const struct stat& status) {
  const fuse_ctx& caller = *fuse_req_ctx(request);
  if (geteuid() != 0 || caller.uid == 0) return 0;
  const mode_t bits = status.st_mode & (S_ISUID | S_ISGID);
  const bool isHarmless = (bits & S_ISGID) != 0 && (status.st_mode & S_IXGRP) == 0;
  return isHarmless && isInGroup(caller, status.st_gid) ? bits & S_ISUID : bits;
}

void takeSetIDAway(fuse_req_t request, int file) {
  struct stat status{};
  const mode_t taken = fstat(file, &status) == 0 ? setIDToTake(request, status) : 0;
  if (taken != 0) (void)fchmod(file, status.st_mode & ALLPERMS & ~taken);
}

}  // namespace yomber
