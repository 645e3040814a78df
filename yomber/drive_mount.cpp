#include "yomber/drive_mount.h"

#include <cerrno>
#include <chrono>
#include <filesystem>

#include <linux/magic.h>
#include <poll.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/vfs.h>
#include <sys/wait.h>
#include <unistd.h>

#include "yomber/mount_users.h"
#include "yomber/supervisor_process.h"

namespace yomber {

namespace {

namespace fs = std::filesystem;
using std::chrono::steady_clock;

/// How long a mount may take until it can be used.
constexpr std::chrono::seconds patience{15};

std::string lockOf(const DrivePaths& paths) { return paths.home + "/mount.lock"; }
/// A symbolic link to the folder, for whoever asks later.
std::string pointOf(const DrivePaths& paths) { return paths.home + "/mount.point"; }

NSErrorRef failure(int code, const std::string& text) {
  return NSError::errorWithDomain(NSPOSIXErrorDomain, code, {{NSLocalizedDescriptionKey, text}});
}

bool isMounted(const std::string& folder) {
  struct statfs status{};
  struct stat inside{};
  struct stat above{};
  return statfs(folder.c_str(), &status) == 0 && status.f_type == FUSE_SUPER_MAGIC &&
         stat(folder.c_str(), &inside) == 0 && stat((folder + "/..").c_str(), &above) == 0 &&
         inside.st_dev != above.st_dev;
}

/// What a mount whose process was killed leaves is no obstacle.
NSErrorRef checkFolder(const DrivePaths& paths, const std::string& folder) {
  if ((folder + "/").starts_with(paths.home + "/") ||
      (paths.home + "/").starts_with(folder + "/")) {
    return failure(EINVAL, "the drive at " + paths.home + " cannot be shown in or around itself");
  }
  struct stat status{};
  if (stat(folder.c_str(), &status) != 0) {
    if (errno == ENOTCONN) return nullptr;
    return failure(errno, folder + ": make this folder first; the drive is shown in it");
  }
  if (!S_ISDIR(status.st_mode)) return failure(ENOTDIR, folder + " is no folder");
  if (isMounted(folder)) return failure(EBUSY, "something is mounted at " + folder + " already");
  std::error_code error;
  if (!fs::is_empty(folder, error)) {
    return failure(ENOTEMPTY, folder + " is not empty; what is in it would be hidden");
  }
  if (access("/dev/fuse", R_OK | W_OK) != 0) {
    if (errno == EACCES) return failure(EACCES, "/dev/fuse is not open to this user");
    return failure(ENODEV, "there is no /dev/fuse; install the package fuse3");
  }
  return nullptr;
}

/// Takes away what nobody uses, without its process's doing; else EBUSY. 0 or an errno.
int takeAwayUnused(const std::string& folder) {
  if (umount2(folder.c_str(), UMOUNT_NOFOLLOW) == 0) return 0;
  if (errno != EPERM) return errno;
  const pid_t child = fork();
  if (child == 0) {
    execlp("fusermount3", "fusermount3", "-u", "-q", "--", folder.c_str(), nullptr);
    _exit(127);
  }
  int status = 0;
  if (child < 0 || waitpid(child, &status, 0) != child) return errno;
  if (status == 0) return 0;
  return isMounted(folder) ? EBUSY : EINVAL;
}

NSErrorRef inUse(const std::string& folder) {
  const std::string users = textOf(usersOfMount(folder));
  return failure(EBUSY, folder + " is in use" +
                            (users.empty() ? ", by whom cannot be seen from here" : ": " + users) +
                            "; close what is open there, or take it away nevertheless with "
                            "'yomber unmount --lazy'");
}

}  // namespace

std::optional<std::string> mountPointOf(const DrivePaths& paths) {
  if (!Supervisor::runningPid(lockOf(paths))) return std::nullopt;
  std::error_code error;
  const fs::path point = fs::read_symlink(pointOf(paths), error);
  if (error) return std::nullopt;
  return point.string();
}

NSErrorRef mountDrive(const DrivePaths& paths, const MountOptions& options) {
  if (const auto point = mountPointOf(paths)) {
    return failure(EBUSY, "the drive is mounted at " + *point + " already; see 'yomber unmount'");
  }
  if (NSErrorRef error = checkFolder(paths, options.folder)) return error;
  std::error_code error;
  fs::remove(pointOf(paths), error);
  fs::create_symlink(options.folder, pointOf(paths), error);
  if (error) return NSError::errorWithErrno(error.value(), pointOf(paths));
  SupervisedProgram program{.name = "yomber-mount",
                            .arguments = {programPath("yomber-mount"), "--home", paths.home},
                            .mayEnd = true};
  if (options.allowOthers) program.arguments.emplace_back("--allow-other");
  if (!options.mayPassThrough) program.arguments.emplace_back("--no-pass-through");
  if (options.keep) {
    program.arguments.insert(program.arguments.end(), {"--keep", std::to_string(*options.keep)});
  }
  program.arguments.push_back(options.folder);
  superviseApart({.paths = paths,
                  .logName = "mount-supervisor",
                  .lockPath = lockOf(paths),
                  .programs = {std::move(program)}});
  const auto deadline = steady_clock::now() + patience;
  while (!isMounted(options.folder)) {
    if (steady_clock::now() > deadline) {
      bool wasMounted = false;
      // Another command may have mounted it elsewhere meanwhile.
      if (mountPointOf(paths) == options.folder) {
        (void)unmountDrive(paths, MayBeInUse::Yes, wasMounted);
      }
      return failure(EIO, "the drive could not be mounted; see 'yomber log'");
    }
    poll(nullptr, 0, 10);
  }
  return nullptr;
}

NSErrorRef unmountDrive(const DrivePaths& paths, MayBeInUse mayBeInUse, bool& wasMounted) {
  const auto point = mountPointOf(paths);
  const int kept = point ? takeAwayUnused(*point) : EINVAL;
  if (kept == EBUSY && mayBeInUse == MayBeInUse::No) return inUse(*point);
  NSErrorRef failed = endSupervision(lockOf(paths), wasMounted);
  wasMounted = wasMounted || kept == 0;  // without its mount it ends by itself
  std::error_code error;
  if (!failed) fs::remove(pointOf(paths), error);
  return failed;
}

}  // namespace yomber
