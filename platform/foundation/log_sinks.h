#pragma once

#include <memory>
#include <string>

#include "platform/foundation/drive_paths.h"
#include "platform/foundation/log.h"

namespace yomber {

/// Opens the default log of this process: to the journal where there is one, else to
/// `<home>/log/<program>.log` (rotating, three files of 10 MiB at most); and to standard error too
/// when YOMBER_LOG_STDERR is "1". The level is from now on the one that the drive's processes
/// share.
///
/// A line shows its time in UTC with microseconds, level, program, process and thread. Control
/// characters are escaped, so that an item's name cannot forge a line. Lines of level default and
/// above are written out at once, others within a second.
/// What cannot be opened is said in the log (standard error, if nothing else), and the rest is
/// used. The directories of `paths` exist already. Called once, when the program starts.
void openLog(const std::string& program, const DrivePaths& paths);

/// Whether logs go to the system's journal on this machine.
[[nodiscard]] bool logsToJournal();
/// The identifier under which `program` of this drive writes to the journal.
[[nodiscard]] std::string journalIdentifier(const std::string& program, const DrivePaths& paths);

/// Where a sink writes; any combination.
struct LogTargets {
  std::string program = {};
  std::string journalIdentifier = {};  ///< empty: not to the journal
  std::string directory = {};          ///< of the log files; empty: none
  bool standardError = false;
};

/// A sink for `targets`; nil and an error when one of them cannot be opened.
[[nodiscard]] std::shared_ptr<Log::Sink> makeLogSink(const LogTargets& targets,
                                                     NSErrorRef* error = nullptr);

}  // namespace yomber
