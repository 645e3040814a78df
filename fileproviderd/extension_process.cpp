#include "fileproviderd/extension_process.h"

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/fileprovider/extension_main.h"
#include "platform/foundation/log.h"
#include "platform/ipc/event_loop.h"

namespace yomber {
namespace {

constexpr int kChildSocket = 3;
constexpr const char* kHomeVariable = "YOMBER_HOME";

// glibc 2.36 declares these two without C linkage.
int openProcess(pid_t pid) { return static_cast<int>(syscall(SYS_pidfd_open, pid, 0)); }
void signalProcess(int process, int signal) {
  (void)syscall(SYS_pidfd_send_signal, process, signal, nullptr, 0);
}

/// What posix_spawn is told, with the memory that it points to.
class SpawnPlan {
 public:
  SpawnPlan(const std::string& program, const std::string& home, int socket) : program_(program) {
    posix_spawn_file_actions_init(&actions_);
    posix_spawnattr_init(&attributes_);
    (void)posix_spawn_file_actions_addopen(&actions_, STDIN_FILENO, "/dev/null", O_RDONLY, 0);
    (void)posix_spawn_file_actions_adddup2(&actions_, socket, kChildSocket);
    (void)posix_spawn_file_actions_addclosefrom_np(&actions_, kChildSocket + 1);
    resetSignals();
    fillEnvironment(home);
  }
  SpawnPlan(const SpawnPlan&) = delete;
  SpawnPlan& operator=(const SpawnPlan&) = delete;
  ~SpawnPlan() {
    posix_spawn_file_actions_destroy(&actions_);
    posix_spawnattr_destroy(&attributes_);
  }

  /// An errno value, 0 for success.
  int run(pid_t* pid) {
    char* const arguments[] = {program_.data(), nullptr};
    std::vector<char*> environment;
    environment.reserve(environment_.size() + 1);
    for (auto& entry : environment_) environment.push_back(entry.data());
    environment.push_back(nullptr);
    return posix_spawn(pid, program_.c_str(), &actions_, &attributes_, arguments,
                       environment.data());
  }

 private:
  /// The child starts with default handlers and nothing blocked, whatever this process has set.
  void resetSignals() {
    sigset_t set;
    sigemptyset(&set);
    posix_spawnattr_setsigmask(&attributes_, &set);
    for (const int signal : {SIGINT, SIGTERM, SIGHUP, SIGPIPE, SIGCHLD}) sigaddset(&set, signal);
    posix_spawnattr_setsigdefault(&attributes_, &set);
    posix_spawnattr_setflags(&attributes_, POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF);
  }

  void fillEnvironment(const std::string& home) {
    for (char** entry = environ; *entry != nullptr; ++entry) {
      const std::string_view text(*entry);
      const auto name = text.substr(0, text.find('='));
      if (name != kHomeVariable && name != kExtensionDescriptorVariable) {
        environment_.emplace_back(text);
      }
    }
    setVariable(kHomeVariable, home);
    setVariable(kExtensionDescriptorVariable, std::to_string(kChildSocket));
  }

  void setVariable(std::string_view name, std::string_view value) {
    auto& entry = environment_.emplace_back(name);
    entry += '=';
    entry += value;
  }

  std::string program_;
  std::vector<std::string> environment_;
  posix_spawn_file_actions_t actions_{};
  posix_spawnattr_t attributes_{};
};

std::string describeEnd(const siginfo_t& info) {
  if (info.si_code == CLD_EXITED) {
    return "ended with exit code " + std::to_string(info.si_status);
  }
  const char* const name = strsignal(info.si_status);
  return "was ended by signal " + std::to_string(info.si_status) + " (" +
         (name != nullptr ? name : "unknown") + ")";
}

NSErrorRef startError(const std::string& program, int number) {
  return NSError::errorWithDomain(
      NSPOSIXErrorDomain, number,
      {{NSFilePathErrorKey, program},
       {NSLocalizedDescriptionKey, "cannot start the drive's extension " + program + ": " +
                                       std::strerror(number) +
                                       "; install it, or name it with --extension"}});
}

}  // namespace

/// Kept by the loop until the process is reaped.
struct ExtensionProcess::Child {
  pid_t pid = 0;
  ipc::UniqueFd descriptor;
  kj::Maybe<kj::UnixEventPort::FdObserver> observer;
  std::function<void(const std::string&)> didExit;
  bool isReaped = false;

  void end() const {
    if (!isReaped) signalProcess(descriptor.get(), SIGKILL);
  }

  void reap() {
    siginfo_t info{};
    if (waitid(P_PIDFD, static_cast<id_t>(descriptor.get()), &info, WEXITED) != 0) {
      log_error(defaultLog(), "[ERROR] cannot reap the extension %d: %s", pid, strerror(errno));
    }
    isReaped = true;
    if (const auto handler = std::exchange(didExit, nullptr)) handler(describeEnd(info));
  }
};

ExtensionProcess::ExtensionProcess(std::shared_ptr<Child> child) : child_(std::move(child)) {}

ExtensionProcess::~ExtensionProcess() {
  child_->didExit = nullptr;
  child_->end();
}

pid_t ExtensionProcess::pid() const { return child_->pid; }

void ExtensionProcess::end() { child_->end(); }

std::shared_ptr<ExtensionProcess> ExtensionProcess::start(
    const std::string& program, const std::string& home, ipc::UniqueFd socket,
    std::function<void(const std::string&)> didExit, NSErrorRef* error) {
  auto child = std::make_shared<Child>();
  const int failure = SpawnPlan(program, home, socket.get()).run(&child->pid);
  if (failure != 0) {
    storeError(error, startError(program, failure));
    return nullptr;
  }
  child->didExit = std::move(didExit);
  child->descriptor.reset(openProcess(child->pid));
  if (!child->descriptor) {
    const int number = errno;
    (void)kill(child->pid, SIGKILL);
    (void)waitpid(child->pid, nullptr, 0);
    storeError(error, startError(program, number));
    return nullptr;
  }
  auto& loop = ipc::EventLoop::shared();
  auto& observer = child->observer.emplace(loop.port(), child->descriptor.get(),
                                           kj::UnixEventPort::FdObserver::OBSERVE_READ);
  loop.detach(observer.whenBecomesReadable().then([child] { child->reap(); }));
  return std::shared_ptr<ExtensionProcess>(new ExtensionProcess(std::move(child)));
}

}  // namespace yomber
