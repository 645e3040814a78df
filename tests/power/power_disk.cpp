#include "tests/power/power_disk.h"

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <stdexcept>

#include <fcntl.h>
#include <sched.h>
#include <sys/mount.h>
#include <unistd.h>

#include "tests/harness/test_drive.h"

namespace yomber::testing {

namespace fs = std::filesystem;

namespace {

/// Ends the test at once: nothing that it says afterwards would mean anything.
void require(bool holds, const std::string& what) {
  if (!holds) throw std::runtime_error("the disk for this test cannot be had: " + what);
}

int run(const std::vector<std::string>& command) {
  const ProcessResult result = runProcess(command);
  if (result.exitCode > 1) std::fprintf(stderr, "%s", (result.output + result.errors).c_str());
  return result.exitCode;
}

/// Mounts of this test are its own: a copy in anybody else's namespace would keep the disk in use.
/// For this thread and those that it starts.
bool leaveSharedMounts() {
  return unshare(CLONE_NEWNS) == 0 &&
         ::mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0;
}

}  // namespace

std::optional<std::string> PowerDisk::reasonItCannotBe() {
  if (geteuid() != 0) return "mounting needs root";
  if (runProcess({"/usr/bin/unshare", "-m", "/bin/true"}).exitCode != 0) {
    return "mounts of its own are not allowed";
  }
  if (access("/dev/fuse", R_OK | W_OK) != 0) return "there is no /dev/fuse";
  if (access("/usr/sbin/mkfs.ext4", X_OK) != 0) return "there is no mkfs.ext4 (e2fsprogs)";
  if (runProcess({"/usr/sbin/losetup", "-f"}).exitCode != 0) return "there are no loop devices";
  return std::nullopt;
}

PowerDisk::PowerDisk(std::uint64_t bytes) {
  require(leaveSharedMounts(), "a mount namespace of its own");
  std::string pattern = (fs::temp_directory_path() / "yomber-disk.XXXXXX").string();
  require(mkdtemp(pattern.data()) != nullptr, pattern);
  directory_ = pattern;
  layer_ = directory_ + "/layer";
  mountPoint_ = directory_ + "/mnt";
  const std::string backing = directory_ + "/backing";
  fs::create_directory(layer_);
  fs::create_directory(mountPoint_);
  std::ofstream(backing).flush();
  fs::resize_file(backing, bytes);
  require(run({"/usr/sbin/mkfs.ext4", "-q", "-E",
               "nodiscard,lazy_itable_init=0,lazy_journal_init=0", backing}) == 0,
          "mkfs.ext4 " + backing);
  process_ = std::make_unique<LineProcess>(
      std::vector<std::string>{programPath("volatile_disk"), backing, layer_});
  require(process_->readUntil([](const std::string& line) { return line == "ready"; }),
          "volatile_disk " + backing);
  mount();
}

PowerDisk::~PowerDisk() {
  if (isMounted_ && run({"/usr/bin/umount", mountPoint_}) != 0) {
    (void)run({"/usr/bin/umount", "-l", mountPoint_});
  }
  // Whoever still has a file of it open keeps it no longer than that.
  if (run({"/usr/bin/umount", layer_}) != 0) (void)run({"/usr/bin/umount", "-l", layer_});
  (void)process_->waitForEnd(std::chrono::seconds(10));
  std::error_code failure;
  fs::remove_all(directory_, failure);
}

void PowerDisk::cut(std::uint64_t seed, unsigned percent) {
  command("cut " + std::to_string(seed) + " " + std::to_string(percent));
}

std::uint64_t PowerDisk::lostBlocks() const {
  std::ifstream statistics(controlPath());
  std::string word;
  std::uint64_t number = 0;
  while (statistics >> word >> number) {
    if (word == "lost") return number;
  }
  throw std::runtime_error("the disk tells nothing");
}

void PowerDisk::unmount() {
  // What still holds it has been killed, and goes within moments.
  isMounted_ = !eventually([&] { return run({"/usr/bin/umount", mountPoint_}) == 0; });
  require(!isMounted_, "unmounting " + mountPoint_);
  require(eventually(
              [&] { return runProcess({"/usr/sbin/losetup", "-j", diskPath()}).output.empty(); }),
          "the loop device of " + diskPath() + " stays");
}

void PowerDisk::comeBack() {
  command("revive");
  // 1: replayed and put right, as after any loss of power.
  const int checked = run({"/usr/sbin/e2fsck", "-fp", diskPath()});
  require(checked == 0 || checked == 1, "the file system is damaged beyond its journal");
  mount();
}

void PowerDisk::command(const std::string& words) const {
  const int control = open(controlPath().c_str(), O_WRONLY | O_CLOEXEC);
  const ssize_t written = write(control, words.data(), words.size());
  close(control);
  require(written == static_cast<ssize_t>(words.size()), words);
}

void PowerDisk::mount() {
  require(run({"/usr/bin/mount", "-t", "ext4", "-o", "loop", diskPath(), mountPoint_}) == 0,
          "mounting " + diskPath());
  isMounted_ = true;
}

}  // namespace yomber::testing
