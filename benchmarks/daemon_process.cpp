#include "benchmarks/daemon_process.h"

#include <csignal>
#include <cstdlib>
#include <stdexcept>

#include "yomber/drive_status.h"

namespace yomber::bench {

void DaemonProcess::adoptEnvironment(testing::TestDrive& drive) {
  for (const auto& [name, value] : drive.environment()) setenv(name.c_str(), value.c_str(), 1);
}

DaemonProcess::DaemonProcess(testing::TestDrive& drive)
    : process_(std::make_unique<testing::LineProcess>(
          std::vector<std::string>{testing::programPath("zarn"), "--home", drive.home()},
          drive.environment())) {
  const auto isDone = [&] {
    const DriveStatus status = readDriveStatus(DrivePaths::forHome(drive.home()), std::nullopt);
    return status.daemon && !status.daemon->scanning;
  };
  if (!testing::eventually(isDone, std::chrono::minutes(10)))
    throw std::runtime_error("the scan did not end");
}

void DaemonProcess::end() {
  kill(process_->pid(), SIGTERM);
  if (process_->waitForEnd() != 0) throw std::runtime_error("zarn did not end well");
  process_.reset();
}

}  // namespace yomber::bench
