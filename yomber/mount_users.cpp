#include "yomber/mount_users.h"

#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <optional>

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>

namespace yomber {

namespace {

namespace fs = std::filesystem;

constexpr std::size_t kNamed = 10;

struct Mount {
  std::uint64_t number = 0;
  std::string device;  ///< as /proc/PID/maps has it
};

/// Where something is mounted, by what this system knows already: whoever serves it may be stuck.
std::optional<Mount> mountAt(const std::string& path, int flags = 0) {
  struct statx status{};
  const int known = AT_STATX_DONT_SYNC | AT_NO_AUTOMOUNT;
  if (statx(AT_FDCWD, path.c_str(), known | flags, STATX_MNT_ID, &status) != 0 ||
      (status.stx_mask & STATX_MNT_ID) == 0) {
    return std::nullopt;
  }
  char device[32];
  std::snprintf(device, sizeof device, "%02x:%02x", status.stx_dev_major, status.stx_dev_minor);
  return Mount{status.stx_mnt_id, device};
}

bool isThere(const fs::path& link, const Mount& mount) {
  const auto found = mountAt(link.string());
  return found && found->number == mount.number;
}

bool hasOpen(const fs::path& process, const Mount& mount) {
  std::error_code error;
  for (fs::directory_iterator file(process / "fd", error), end; !error && file != end;
       file.increment(error)) {
    if (isThere(file->path(), mount)) return true;
  }
  return false;
}

/// Each line of maps: addresses, rights, offset, device, inode, path.
bool hasMapped(const fs::path& process, const Mount& mount) {
  std::ifstream maps(process / "maps");
  for (std::string line; std::getline(maps, line);) {
    std::size_t at = 0;
    for (int column = 0; column < 3 && at != std::string::npos; ++column) {
      at = line.find(' ', at);
      if (at != std::string::npos) ++at;
    }
    if (at != std::string::npos &&
        line.compare(at, mount.device.size() + 1, mount.device + " ") == 0)
      return true;
  }
  return false;
}

bool uses(const fs::path& process, const Mount& mount) {
  return isThere(process / "cwd", mount) || isThere(process / "root", mount) ||
         isThere(process / "exe", mount) || hasOpen(process, mount) || hasMapped(process, mount);
}

std::string nameOf(const fs::path& process) {
  std::ifstream file(process / "comm");
  std::string name;
  std::getline(file, name);
  return name;
}

}  // namespace

std::vector<MountUser> usersOfMount(const std::string& folder) {
  std::vector<MountUser> users;
  const auto mount = mountAt(folder, AT_SYMLINK_NOFOLLOW);
  if (!mount) return users;
  std::error_code error;
  for (fs::directory_iterator process("/proc", error), end; !error && process != end;
       process.increment(error)) {
    const std::string number = process->path().filename().string();
    if (number.find_first_not_of("0123456789") != std::string::npos) continue;
    if (uses(process->path(), *mount))
      users.push_back({std::stoi(number), nameOf(process->path())});
  }
  std::sort(users.begin(), users.end(),
            [](const MountUser& a, const MountUser& b) { return a.pid < b.pid; });
  return users;
}

std::string textOf(const std::vector<MountUser>& users) {
  std::string text;
  for (std::size_t i = 0; i < std::min(users.size(), kNamed); ++i) {
    text += (i == 0 ? "" : ", ") + users[i].name + " (" + std::to_string(users[i].pid) + ")";
  }
  if (users.size() > kNamed) text += " and " + std::to_string(users.size() - kNamed) + " more";
  return text;
}

}  // namespace yomber
