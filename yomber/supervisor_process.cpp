#include "yomber/supervisor_process.h"

#include <chrono>
#include <csignal>
#include <filesystem>
#include <optional>

#include <fcntl.h>
#include <poll.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

extern "C" {
#include <sys/pidfd.h>  // Debian 12's does not say extern "C" itself
}

#include "platform/foundation/file_descriptor.h"
#include "platform/foundation/log_sinks.h"

namespace yomber {

namespace {

/// How long a supervisor gets to end.
constexpr std::chrono::milliseconds patience{30'000};

void closeInheritedDescriptors() {
  const int null = open("/dev/null", O_RDWR | O_CLOEXEC);
  for (const int standard : {STDIN_FILENO, STDOUT_FILENO, STDERR_FILENO}) dup2(null, standard);
  close_range(STDERR_FILENO + 1, ~0U, 0);
}

}  // namespace

std::string programPath(const std::string& name) {
  std::error_code failure;
  const auto self = std::filesystem::read_symlink("/proc/self/exe", failure);
  return (self.parent_path() / name).string();
}

NSErrorRef superviseHere(const Supervision& supervision) {
  Supervisor supervisor(supervision.lockPath, supervision.programs);
  if (NSErrorRef error = supervisor.takeLock()) return error;
  openLog(supervision.logName, supervision.paths);
  supervisor.run();
  return nullptr;
}

void superviseApart(const Supervision& supervision) {
  const pid_t first = fork();
  if (first == 0) {
    setsid();
    if (fork() != 0) _exit(0);
    closeInheritedDescriptors();
    _exit(superviseHere(supervision) ? 1 : 0);
  }
  waitpid(first, nullptr, 0);
}

NSErrorRef endSupervision(const std::string& lockPath, bool& wasRunning) {
  const std::optional<pid_t> pid = Supervisor::runningPid(lockPath);
  const FileDescriptor process(pid ? pidfd_open(*pid, 0) : -1);
  wasRunning = static_cast<bool>(process);
  if (!process) return nullptr;
  pidfd_send_signal(process.get(), SIGTERM, nullptr, 0);
  pollfd ended{process.get(), POLLIN, 0};
  if (poll(&ended, 1, static_cast<int>(patience.count())) == 1) return nullptr;
  return NSError::errorWithDomain(
      NSPOSIXErrorDomain, ETIMEDOUT,
      {{NSLocalizedDescriptionKey,
        "the supervisor (pid " + std::to_string(*pid) + ") did not end"}});
}

}  // namespace yomber
