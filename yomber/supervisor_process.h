#pragma once

#include <string>
#include <vector>

#include "platform/foundation/drive_paths.h"
#include "platform/foundation/error.h"
#include "yomber/supervisor.h"

namespace yomber {

/// Some programs of a drive, and the process that keeps them running. Used on the main thread.
struct Supervision {
  DrivePaths paths;
  std::string logName;
  std::string lockPath;
  std::vector<SupervisedProgram> programs;
};

/// Where the program of that name stands: beside this one.
[[nodiscard]] std::string programPath(const std::string& name);

/// Returns when a signal has ended them, or fails with EWOULDBLOCK when they are kept already.
[[nodiscard]] NSErrorRef superviseHere(const Supervision& supervision);
/// The same in a session of its own, which no terminal's end takes down.
void superviseApart(const Supervision& supervision);
/// Ends the process that keeps them, if there is one, and waits for it.
[[nodiscard]] NSErrorRef endSupervision(const std::string& lockPath, bool& wasRunning);

}  // namespace yomber
