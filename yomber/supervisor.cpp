#include "yomber/supervisor.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <csignal>

#include <fcntl.h>
#include <poll.h>
#include <sys/prctl.h>
#include <sys/signalfd.h>
#include <sys/wait.h>
#include <unistd.h>

#include "platform/foundation/log.h"

namespace yomber {

namespace {

using std::chrono::milliseconds;
using std::chrono::steady_clock;

constexpr milliseconds firstBackOff{50};
constexpr milliseconds lastBackOff{5000};
/// A program that stayed up this long is started again without delay.
constexpr std::chrono::seconds settledAfter{1};
/// What programs get between SIGTERM and SIGKILL.
constexpr std::chrono::seconds patience{10};

flock wholeFile(short type) {
  flock lock{};
  lock.l_type = type;
  lock.l_whence = SEEK_SET;
  return lock;
}

sigset_t handledSignals() {
  sigset_t set;
  sigemptyset(&set);
  for (const int number : {SIGCHLD, SIGTERM, SIGINT, SIGHUP}) sigaddset(&set, number);
  return set;
}

[[noreturn]] void becomeProgram(const SupervisedProgram& program, pid_t supervisor) {
  prctl(PR_SET_PDEATHSIG, SIGTERM);
  if (getppid() != supervisor) _exit(0);  // the supervisor went before the line above took hold
  const sigset_t none = [] {
    sigset_t set;
    sigemptyset(&set);
    return set;
  }();
  sigprocmask(SIG_SETMASK, &none, nullptr);
  std::vector<char*> arguments;
  for (const std::string& argument : program.arguments)
    arguments.push_back(const_cast<char*>(argument.c_str()));
  arguments.push_back(nullptr);
  execv(arguments[0], arguments.data());
  _exit(127);
}

}  // namespace

Supervisor::Supervisor(std::string lockPath, std::vector<SupervisedProgram> programs)
    : lockPath_(std::move(lockPath)) {
  for (SupervisedProgram& program : programs) {
    Child child;
    child.program = std::move(program);
    children_.push_back(std::move(child));
  }
}

NSErrorRef Supervisor::takeLock() {
  const sigset_t signals = handledSignals();
  sigprocmask(SIG_BLOCK, &signals, nullptr);
  lockDescriptor_ = open(lockPath_.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0600);
  if (lockDescriptor_ < 0) return NSError::errorWithErrno(errno, lockPath_);
  flock lock = wholeFile(F_WRLCK);
  if (fcntl(lockDescriptor_, F_SETLK, &lock) != 0)
    return NSError::errorWithErrno(EWOULDBLOCK, lockPath_);
  return nullptr;
}

std::optional<pid_t> Supervisor::runningPid(const std::string& lockPath) {
  const int descriptor = open(lockPath.c_str(), O_RDWR | O_CLOEXEC | O_NOFOLLOW);
  if (descriptor < 0) return std::nullopt;
  flock lock = wholeFile(F_WRLCK);
  const int answer = fcntl(descriptor, F_GETLK, &lock);
  close(descriptor);
  if (answer != 0 || lock.l_type == F_UNLCK) return std::nullopt;
  return lock.l_pid;
}

void Supervisor::run() {
  const sigset_t signals = handledSignals();
  const int signalDescriptor = signalfd(-1, &signals, SFD_CLOEXEC | SFD_NONBLOCK);
  while (!isEnding_) {
    startDue();
    pollfd waiting{signalDescriptor, POLLIN, 0};
    poll(&waiting, 1, millisecondsUntilNextStart());
    signalfd_siginfo info;
    while (read(signalDescriptor, &info, sizeof info) == static_cast<ssize_t>(sizeof info)) {
      isEnding_ = isEnding_ || info.ssi_signo == SIGTERM || info.ssi_signo == SIGINT;
    }
    reap();
  }
  endAll();
  close(signalDescriptor);
}

void Supervisor::start(Child& child) {
  const pid_t self = getpid();
  child.startedAt = steady_clock::now();
  const pid_t pid = fork();
  if (pid == 0) becomeProgram(child.program, self);
  if (pid < 0) {
    scheduleRestart(child, 0);
    return;
  }
  child.pid = pid;
  log_info(defaultLog(), "[INFO] started %s, pid %d", child.program.name, pid);
}

void Supervisor::scheduleRestart(Child& child, int status) {
  const auto now = steady_clock::now();
  const bool settled = child.pid != 0 && now - child.startedAt >= settledAfter;
  child.backOff =
      settled ? milliseconds(0) : std::min(std::max(child.backOff * 2, firstBackOff), lastBackOff);
  child.startAgainAt = now + child.backOff;
  child.pid = 0;
  log_error(defaultLog(), "[ERROR] %s ended (status %d); starting it again in %lld ms",
            child.program.name, status, static_cast<long long>(child.backOff.count()));
}

void Supervisor::startDue() {
  const auto now = steady_clock::now();
  for (Child& child : children_) {
    if (child.pid == 0 && child.startAgainAt <= now) start(child);
  }
}

void Supervisor::reap() {
  int status = 0;
  for (pid_t pid = waitpid(-1, &status, WNOHANG); pid > 0; pid = waitpid(-1, &status, WNOHANG)) {
    const auto child = std::ranges::find(children_, pid, &Child::pid);
    if (child == children_.end()) continue;
    const bool hasSucceeded = WIFEXITED(status) && WEXITSTATUS(status) == 0;
    if (hasSucceeded && child->program.mayEnd) {
      isEnding_ = true;
      child->pid = 0;
      log_info(defaultLog(), "[INFO] %s has ended", child->program.name);
    } else {
      scheduleRestart(*child, status);
    }
  }
}

int Supervisor::millisecondsUntilNextStart() const {
  int wait = -1;
  const auto now = steady_clock::now();
  for (const Child& child : children_) {
    if (child.pid != 0) continue;
    const auto left = std::chrono::ceil<milliseconds>(child.startAgainAt - now).count();
    const int bounded = static_cast<int>(std::clamp<long long>(left, 0, lastBackOff.count()));
    wait = wait < 0 ? bounded : std::min(wait, bounded);
  }
  return wait;
}

void Supervisor::endAll() {
  const auto deadline = steady_clock::now() + patience;
  // In the reverse order of their start: who needs another goes before it.
  for (auto child = children_.rbegin(); child != children_.rend(); ++child) {
    if (child->pid == 0) continue;
    kill(child->pid, SIGTERM);
    const sigset_t signals = handledSignals();
    while (waitpid(child->pid, nullptr, WNOHANG) == 0) {
      const auto left = std::chrono::ceil<milliseconds>(deadline - steady_clock::now()).count();
      if (left <= 0) {
        kill(child->pid, SIGKILL);
        waitpid(child->pid, nullptr, 0);
        break;
      }
      const timespec pause{left / 1000, (left % 1000) * 1000000};
      sigtimedwait(&signals, nullptr, &pause);
    }
    child->pid = 0;
  }
}

}  // namespace yomber
