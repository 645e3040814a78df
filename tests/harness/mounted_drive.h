#pragma once

#include <string>
#include <vector>

#include "tests/harness/test_drive.h"

namespace yomber::testing {

/// A drive that is up and mounted in a folder of its own, in the way that mount_kind.h tells.
/// Unmounted and removed when the object goes.
class MountedDrive {
 public:
  /// `gates` are fault points (platform/foundation/fault_points.h) that hold up whoever comes there
  /// until they are opened, `failing` such where whatever is done there fails, `turnstiles` gates
  /// that are open at first and hold up one at a time. `environment` is for the drive's processes.
  explicit MountedDrive(std::vector<std::string> gates = {},
                        const std::vector<std::string>& failing = {},
                        const Environment& environment = {},
                        const std::vector<std::string>& turnstiles = {});
  ~MountedDrive();
  MountedDrive(const MountedDrive&) = delete;
  MountedDrive& operator=(const MountedDrive&) = delete;

  TestDrive& drive() { return drive_; }
  /// Where the drive is mounted.
  [[nodiscard]] const std::string& folder() const { return folder_; }
  [[nodiscard]] std::string at(const std::string& path) const { return folder_ + "/" + path; }
  /// The same place in the tree on the disk.
  [[nodiscard]] std::string onDisk(const std::string& path) const;

  /// Whether anybody has come to a gate.
  [[nodiscard]] bool isReached(const std::string& gate) const;
  /// Lets everybody through, now and later.
  void openGate(const std::string& gate) const;
  /// Holds up whoever comes to an open gate next, and nobody else, until it is opened again. For
  /// those of `turnstiles`.
  void closeGate(const std::string& gate) const;

  void mount(const std::vector<std::string>& options = {});
  void unmount();
  /// As its user does who asks nobody of the drive; false when nothing was mounted.
  [[nodiscard]] bool takeAway() const;
  /// The pid of yomber-mount, waiting until there is one; throws when none comes.
  [[nodiscard]] pid_t pid() const;

 private:
  [[nodiscard]] std::string fileOf(const std::string& gate) const;

  std::vector<std::string> gates_;
  TestDrive drive_;
  std::string folder_;
};

}  // namespace yomber::testing
