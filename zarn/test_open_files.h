#pragma once

#include <filesystem>
#include <string>
#include <system_error>

#include "zarn/test_waiting.h"

namespace yomber {

/// Whether this process has anything open in a folder.
[[nodiscard]] inline bool hasOpenFileIn(const std::string& folder) {
  for (const auto& each : std::filesystem::directory_iterator("/proc/self/fd")) {
    std::error_code gone;
    const auto target = std::filesystem::read_symlink(each.path(), gone).string();
    if (target.starts_with(folder + "/")) return true;
  }
  return false;
}

/// To be called before a fork: threads that end may hold the drive's last reference a little longer
/// than whoever gave up his own, and a child that inherits an open database cannot open it.
[[nodiscard]] inline bool waitUntilNothingIsOpenIn(const std::string& folder) {
  return waitUntil([&] { return !hasOpenFileIn(folder); });
}

}  // namespace yomber
