#include "platform/drawing/spawned_process.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>

#include "platform/drawing/waiting.h"
#include "platform/foundation/file_descriptor.h"

namespace yomber {
namespace {

/// What posix_spawn is told.
class SpawnPlan {
 public:
  SpawnPlan(int socket, int asDescriptor) {
    posix_spawn_file_actions_init(&actions_);
    posix_spawnattr_init(&attributes_);
    // What its libraries say of damaged files is nobody's log.
    for (const int stream : {STDIN_FILENO, STDOUT_FILENO, STDERR_FILENO})
      (void)posix_spawn_file_actions_addopen(&actions_, stream, "/dev/null", O_RDWR, 0);
    if (socket >= 0) (void)posix_spawn_file_actions_adddup2(&actions_, socket, asDescriptor);
    const int first = socket >= 0 ? asDescriptor + 1 : STDERR_FILENO + 1;
    (void)posix_spawn_file_actions_addclosefrom_np(&actions_, first);
    sigset_t set;
    sigemptyset(&set);
    posix_spawnattr_setsigmask(&attributes_, &set);
    for (const int signal : {SIGINT, SIGTERM, SIGHUP, SIGPIPE, SIGCHLD}) sigaddset(&set, signal);
    posix_spawnattr_setsigdefault(&attributes_, &set);
    posix_spawnattr_setpgroup(&attributes_, 0);
    posix_spawnattr_setflags(
        &attributes_, POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF | POSIX_SPAWN_SETPGROUP);
  }
  SpawnPlan(const SpawnPlan&) = delete;
  SpawnPlan& operator=(const SpawnPlan&) = delete;
  ~SpawnPlan() {
    posix_spawn_file_actions_destroy(&actions_);
    posix_spawnattr_destroy(&attributes_);
  }

  int run(std::vector<std::string>& arguments, std::vector<std::string>& environment,
          pid_t* pid) const {
    return posix_spawn(pid, arguments.front().c_str(), &actions_, &attributes_,
                       pointers(arguments).data(), pointers(environment).data());
  }

 private:
  static std::vector<char*> pointers(std::vector<std::string>& words) {
    std::vector<char*> result;
    result.reserve(words.size() + 1);
    for (std::string& word : words) result.push_back(word.data());
    result.push_back(nullptr);
    return result;
  }

  posix_spawn_file_actions_t actions_{};
  posix_spawnattr_t attributes_{};
};

}  // namespace

SpawnedProcess::~SpawnedProcess() {
  kill();
  reap();
}

int SpawnedProcess::start(std::vector<std::string> arguments, std::vector<std::string> environment,
                          int socket, int asDescriptor) {
  const int number = SpawnPlan(socket, asDescriptor).run(arguments, environment, &pid_);
  if (number != 0) pid_ = 0;
  return number;
}

bool SpawnedProcess::isAlive() {
  reap(WNOHANG);
  return pid_ != 0;
}

bool SpawnedProcess::waitFor(std::chrono::milliseconds patience) {
  if (pid_ == 0) return true;
  const auto deadline = std::chrono::steady_clock::now() + patience;
  // glibc 2.36 declares pidfd_open without C linkage.
  const FileDescriptor process(static_cast<int>(syscall(SYS_pidfd_open, pid_, 0)));
  if (process && !waitReadable(process.get(), deadline)) return !isAlive();
  // Without a descriptor left for it, it is asked now and then.
  while (isAlive() && std::chrono::steady_clock::now() < deadline) (void)poll(nullptr, 0, 5);
  return !isAlive();
}

void SpawnedProcess::kill() const {
  if (pid_ != 0) (void)::kill(pid_, SIGKILL);
}

void SpawnedProcess::reap() { reap(0); }

void SpawnedProcess::reap(int options) {
  if (pid_ == 0) return;
  int status = 0;
  pid_t reaped = 0;
  do {
    reaped = waitpid(pid_, &status, options);
  } while (reaped < 0 && errno == EINTR);
  if (reaped == 0) return;
  if (reaped == pid_ && WIFEXITED(status)) exitCode_ = WEXITSTATUS(status);
  pid_ = 0;
}

}  // namespace yomber
