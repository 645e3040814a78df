#pragma once

#include <sys/stat.h>

#include <fstream>
#include <string>

namespace yomber {

/// Whether somebody waits for the end of a lease on that file.
[[nodiscard]] inline bool isLeaseWaitedFor(const struct stat& file) {
  const std::string inode = ":" + std::to_string(file.st_ino) + " ";
  std::ifstream locks("/proc/locks");
  for (std::string line; std::getline(locks, line);) {
    if (line.find("BREAKING") != std::string::npos && line.find(inode) != std::string::npos) {
      return true;
    }
  }
  return false;
}

}  // namespace yomber
