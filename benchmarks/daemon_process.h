#pragma once

#include <memory>

#include "tests/harness/child_process.h"
#include "tests/harness/test_drive.h"

namespace yomber::bench {

/// A zarn without supervisor and host, over the home of a drive that is not up.
class DaemonProcess {
 public:
  /// Lets the drive's places hold for this process too: its sockets are found by the environment.
  static void adoptEnvironment(testing::TestDrive& drive);

  /// Starts it and returns when its scan is done.
  explicit DaemonProcess(testing::TestDrive& drive);
  /// Ends it; throws when it did not end well.
  void end();

 private:
  std::unique_ptr<testing::LineProcess> process_;
};

}  // namespace yomber::bench
