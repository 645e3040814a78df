#include "tests/harness/mounted_drive.h"

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <optional>
#include <stdexcept>
#include <utility>

#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include "tests/harness/mount_kind.h"

namespace yomber::testing {

namespace fs = std::filesystem;

namespace {

/// A process's words, each with a zero behind it; empty when it has ended.
std::string commandLineOf(const fs::path& process) {
  std::string words;
  std::FILE* const file = std::fopen((process / "cmdline").c_str(), "r");
  if (file == nullptr) return words;
  for (int byte = std::fgetc(file); byte != EOF; byte = std::fgetc(file)) {
    words += static_cast<char>(byte);
  }
  (void)std::fclose(file);
  return words;
}

/// The process of that name among whose arguments is `argument`.
std::optional<pid_t> processWith(const std::string& name, const std::string& argument) {
  const std::string wanted = std::string(1, '\0') + argument + std::string(1, '\0');
  for (const auto& process : fs::directory_iterator("/proc")) {
    const std::string words = commandLineOf(process.path());
    const std::string program = fs::path(words.c_str()).filename();
    if (program == name && words.find(wanted) != std::string::npos) {
      return std::stoi(process.path().filename());
    }
  }
  return std::nullopt;
}

}  // namespace

MountedDrive::MountedDrive(std::vector<std::string> gates, const std::vector<std::string>& failing,
                           const Environment& environment,
                           const std::vector<std::string>& turnstiles)
    : gates_(std::move(gates)) {
  for (const auto& [name, value] : environment) drive_.environment()[name] = value;
  std::string pattern = (fs::temp_directory_path() / "yomber-mount-XXXXXX").string();
  if (mkdtemp(pattern.data()) == nullptr) throw std::runtime_error("no folder to mount in");
  folder_ = pattern;
  std::string faults;
  for (const std::string& gate : gates_) faults += gate + "=pause-until-file:" + fileOf(gate) + ",";
  for (const std::string& point : failing) faults += point + "=error,";
  for (const std::string& gate : turnstiles) {
    faults += gate + "=pause-first-until-file:" + fileOf(gate) + ",";
    openGate(gate);
  }
  gates_.insert(gates_.end(), turnstiles.begin(), turnstiles.end());
  if (!faults.empty()) drive_.environment()["YOMBER_FAULTS"] = faults;
  chmod(folder_.c_str(), 0755);
  drive_.up();
  mount();
}

MountedDrive::~MountedDrive() {
  for (const std::string& gate : gates_) openGate(gate);
  unmount();
  (void)takeAway();
  std::error_code failure;
  fs::remove(folder_, failure);
}

void MountedDrive::closeGate(const std::string& gate) const {
  // In this order: until the second has gone, everybody passes.
  fs::remove(fileOf(gate));
  fs::remove(fileOf(gate) + ".reached");
}

std::string MountedDrive::fileOf(const std::string& gate) const {
  return drive_.home() + "/gate." + gate;
}

bool MountedDrive::isReached(const std::string& gate) const {
  return fs::exists(fileOf(gate) + ".reached");
}

void MountedDrive::openGate(const std::string& gate) const { std::ofstream(fileOf(gate)).put('x'); }

std::string MountedDrive::onDisk(const std::string& path) const {
  return drive_.root() + "/" + path;
}

void MountedDrive::mount(const std::vector<std::string>& options) {
  std::vector<std::string> command{"mount", folder_};
  command.insert(command.end(), options.begin(), options.end());
  if (mountKind() == MountKind::Cached) command.emplace_back("--no-pass-through");
  const ProcessResult result = drive_.yomber(command);
  if (result.exitCode != 0) {
    throw std::runtime_error("the drive cannot be mounted: " + result.errors);
  }
}

void MountedDrive::unmount() { (void)drive_.yomber({"unmount", "--lazy"}); }

bool MountedDrive::takeAway() const {
  if (umount2(folder_.c_str(), MNT_DETACH) == 0) return true;
  return errno == EPERM && runProcess({"/usr/bin/fusermount3", "-u", "-z", folder_}).exitCode == 0;
}

pid_t MountedDrive::pid() const {
  std::optional<pid_t> found;
  (void)eventually([&] {
    found = processWith("yomber-mount", folder_);
    return found.has_value();
  });
  // No number stands for "none" here: a test may kill what it gets.
  if (!found) throw std::runtime_error("the drive's mount has no process");
  return *found;
}

}  // namespace yomber::testing
