#pragma once

#include <string>

namespace yomber::fuzz {

/// Where the drive of the target that serves a daemon lies: always the same, so that an input that
/// names its files means the same in every run and on every machine.
inline constexpr const char* kDaemonHome = "/tmp/yomber-fuzz-daemon";
/// Its root folder.
inline constexpr const char* kDaemonRoot =
    "/tmp/yomber-fuzz-daemon/tree/com.kelvo.YomberDrive/Documents";

/// Makes the folder at `path`, private and empty; ends the process when it is somebody else's or
/// another process uses it.
void claimHome(const std::string& path);

}  // namespace yomber::fuzz
