#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include <sys/types.h>

#include <nlohmann/json_fwd.hpp>

#include "platform/foundation/drive_paths.h"
#include "platform/foundation/error.h"
#include "yomber/drive_content.h"

namespace yomber {

/// What the drive's processes say of themselves; a part is missing when its process does not
/// answer.
struct DriveStatus {
  struct Daemon {
    std::uint32_t pid = 0;
    std::uint64_t items = 0;
    std::uint64_t folders = 0;
    std::uint64_t rank = 0;
    bool scanning = false;
    bool live = true;
    std::string advice;  ///< what to do when observation is not live
    std::uint64_t watchedFolders = 0;
    std::uint32_t watchers = 0;
    std::uint64_t residentBytes = 0;
    std::uint32_t openDescriptors = 0;
  };
  struct Host {
    std::uint32_t extensionPid = 0;
    std::uint64_t extensionStarts = 0;
    std::uint32_t watches = 0;
    std::uint32_t enumerators = 0;
    std::uint64_t residentBytes = 0;
    std::uint32_t openDescriptors = 0;
    NSErrorRef lastFailure;  ///< why there is no extension
  };

  std::string home;
  std::optional<pid_t> supervisor;
  std::optional<std::string> mountPoint;
  std::optional<std::string> account;
  std::optional<Daemon> daemon;
  std::optional<Host> host;
  std::optional<Transfers> transfers;
};

[[nodiscard]] DriveStatus readDriveStatus(const DrivePaths& paths, std::optional<pid_t> supervisor);
[[nodiscard]] std::string statusText(const DriveStatus& status);
[[nodiscard]] nlohmann::ordered_json statusJson(const DriveStatus& status);

}  // namespace yomber
