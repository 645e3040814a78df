#include "tests/harness/mount_kind.h"

#include <cstdlib>
#include <filesystem>
#include <optional>
#include <stdexcept>
#include <string>

#include <fcntl.h>
#include <grp.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <gtest/gtest.h>

namespace yomber::testing {

namespace {

constexpr uid_t kNobody = 65534;
constexpr const char* kDevice = "/dev/fuse";

/// The device as every desktop has it: for all. In mounts of this process's own, so that nobody
/// else sees it, and with a name for the moment only.
bool openTheDeviceToAll() {
  constexpr unsigned kMajor = 10;
  constexpr unsigned kMinor = 229;
  std::string folder = (std::filesystem::temp_directory_path() / "yomber-device-XXXXXX").string();
  if (unshare(CLONE_NEWNS) != 0 || mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0 ||
      mkdtemp(folder.data()) == nullptr) {
    return false;
  }
  const std::string device = folder + "/fuse";
  const bool isOpen = mknod(device.c_str(), S_IFCHR | 0600, makedev(kMajor, kMinor)) == 0 &&
                      chmod(device.c_str(), 0666) == 0 &&
                      mount(device.c_str(), kDevice, nullptr, MS_BIND, nullptr) == 0;
  unlink(device.c_str());
  rmdir(folder.c_str());
  return isOpen;
}

bool mayOpenTheDevice() {
  const int device = open(kDevice, O_RDWR | O_CLOEXEC);
  if (device >= 0) close(device);
  return device >= 0;
}

bool becomeNobody() {
  return setgroups(0, nullptr) == 0 && setresgid(kNobody, kNobody, kNobody) == 0 &&
         setresuid(kNobody, kNobody, kNobody) == 0 &&
         // What is ours in /proc is ours again.
         prctl(PR_SET_DUMPABLE, 1, 0, 0, 0) == 0;
}

std::optional<std::string> reasonThereIsNoSuchMount() {
  if (mountKind() == MountKind::Best) return std::nullopt;
  if (geteuid() != 0) return "without root every mount is an ordinary user's already";
  if (mountKind() == MountKind::Cached) return std::nullopt;
  if (access("/usr/bin/fusermount3", X_OK) != 0) return "there is no fusermount3 (fuse3)";
  if (!openTheDeviceToAll()) return "mounts of its own are not allowed";
  if (!becomeNobody()) return "the user cannot be changed";
  if (!mayOpenTheDevice()) return "an ordinary user may not open /dev/fuse";
  return std::nullopt;
}

/// Before the first test: what comes after it is the user's.
class MountKindEnvironment : public ::testing::Environment {
 public:
  void SetUp() override {
    if (const auto reason = reasonThereIsNoSuchMount()) GTEST_SKIP() << *reason;
  }
};

[[maybe_unused]] const auto* const environment =
    ::testing::AddGlobalTestEnvironment(new MountKindEnvironment);

}  // namespace

MountKind mountKind() {
  const char* const kind = std::getenv("YOMBER_MOUNT");
  if (kind == nullptr) return MountKind::Best;
  if (std::string(kind) == "cached") return MountKind::Cached;
  if (std::string(kind) == "user") return MountKind::User;
  throw std::invalid_argument("YOMBER_MOUNT is \"cached\" or \"user\"");
}

}  // namespace yomber::testing
