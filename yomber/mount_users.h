#pragma once

#include <string>
#include <vector>

#include <sys/types.h>

namespace yomber {

/// A process that has something of a file system in use: open, mapped, its working folder, its root
/// or its program.
struct MountUser {
  pid_t pid = 0;
  std::string name;
};

/// Those that use the file system mounted at `folder`, by pid, as far as this process may see.
/// Asks nobody who serves the file system.
[[nodiscard]] std::vector<MountUser> usersOfMount(const std::string& folder);

/// "cat (17), vim (23)"; of many, the first.
[[nodiscard]] std::string textOf(const std::vector<MountUser>& users);

}  // namespace yomber
