#pragma once

#include <string>
#include <vector>

#include "tests/harness/test_drive.h"

namespace yomber::testing {

/// A drive that is up and mounted in a folder of its own. Unmounted and removed when the object
/// goes.
class MountedDrive {
 public:
  MountedDrive();
  ~MountedDrive();
  MountedDrive(const MountedDrive&) = delete;
  MountedDrive& operator=(const MountedDrive&) = delete;

  TestDrive& drive() { return drive_; }
  /// Where the drive is mounted.
  [[nodiscard]] const std::string& folder() const { return folder_; }
  [[nodiscard]] std::string at(const std::string& path) const { return folder_ + "/" + path; }
  /// The same place in the tree on the disk.
  [[nodiscard]] std::string onDisk(const std::string& path) const;

  void mount(const std::vector<std::string>& options = {});
  void unmount();
  /// The pid of yomber-mount, waiting until there is one; throws when none comes.
  [[nodiscard]] pid_t pid() const;

 private:
  TestDrive drive_;
  std::string folder_;
};

}  // namespace yomber::testing
