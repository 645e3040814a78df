#include "tests/harness/child_process.h"

#include <array>
#include <cerrno>
#include <csignal>

#include <fcntl.h>
#include <poll.h>
#include <spawn.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

extern "C" {
#include <sys/pidfd.h>  // Debian 12's does not say extern "C" itself
}

extern char** environ;

namespace yomber::testing {

namespace {

using std::chrono::milliseconds;
using std::chrono::steady_clock;

int millisecondsLeft(steady_clock::time_point deadline) {
  const auto left = std::chrono::ceil<milliseconds>(deadline - steady_clock::now()).count();
  return left < 0 ? 0 : static_cast<int>(left);
}

std::vector<std::string> environmentWith(const Environment& extra) {
  std::vector<std::string> variables;
  for (char** variable = environ; *variable != nullptr; ++variable) {
    const std::string text = *variable;
    if (!extra.contains(text.substr(0, text.find('=')))) variables.push_back(text);
  }
  for (const auto& [name, value] : extra) variables.push_back(name + "=" + value);
  return variables;
}

std::vector<char*> pointersTo(std::vector<std::string>& strings) {
  std::vector<char*> pointers;
  for (std::string& string : strings) pointers.push_back(string.data());
  pointers.push_back(nullptr);
  return pointers;
}

/// Starts a program with its standard output, and error where it is given, on the given
/// descriptors.
pid_t spawn(std::vector<std::string> arguments, const Environment& extra, int output, int errors) {
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_addopen(&actions, STDIN_FILENO, "/dev/null", O_RDONLY, 0);
  posix_spawn_file_actions_adddup2(&actions, output, STDOUT_FILENO);
  if (errors >= 0) {
    posix_spawn_file_actions_adddup2(&actions, errors, STDERR_FILENO);
  } else {
    posix_spawn_file_actions_addopen(&actions, STDERR_FILENO, "/dev/null", O_WRONLY, 0);
  }
  std::vector<std::string> environment = environmentWith(extra);
  pid_t pid = -1;
  const int failure = posix_spawn(&pid, arguments[0].c_str(), &actions, nullptr,
                                  pointersTo(arguments).data(), pointersTo(environment).data());
  posix_spawn_file_actions_destroy(&actions);
  return failure == 0 ? pid : -1;
}

/// Appends what can be read; false at the end.
bool drain(int descriptor, std::string& into) {
  std::array<char, 65536> bytes{};
  const ssize_t count = read(descriptor, bytes.data(), bytes.size());
  if (count > 0) into.append(bytes.data(), static_cast<std::size_t>(count));
  return count > 0 || (count < 0 && errno == EINTR);
}

int exitCodeOf(int status) { return WIFEXITED(status) ? WEXITSTATUS(status) : -WTERMSIG(status); }

}  // namespace

ProcessResult runProcess(const std::vector<std::string>& arguments, const Environment& extra,
                         milliseconds limit) {
  std::array<int, 2> output{};
  std::array<int, 2> errors{};
  ProcessResult result;
  if (pipe2(output.data(), O_CLOEXEC) != 0 || pipe2(errors.data(), O_CLOEXEC) != 0) return result;
  const pid_t pid = spawn(arguments, extra, output[1], errors[1]);
  close(output[1]);
  close(errors[1]);
  const auto deadline = steady_clock::now() + limit;
  std::array<pollfd, 2> waiting{pollfd{output[0], POLLIN, 0}, pollfd{errors[0], POLLIN, 0}};
  while (pid > 0 && (waiting[0].fd >= 0 || waiting[1].fd >= 0)) {
    if (poll(waiting.data(), waiting.size(), millisecondsLeft(deadline)) == 0) {
      result.timedOut = true;
      kill(pid, SIGKILL);
      break;
    }
    if (waiting[0].revents != 0 && !drain(output[0], result.output)) waiting[0].fd = -1;
    if (waiting[1].revents != 0 && !drain(errors[0], result.errors)) waiting[1].fd = -1;
  }
  close(output[0]);
  close(errors[0]);
  int status = 0;
  if (pid > 0 && waitpid(pid, &status, 0) == pid) result.exitCode = exitCodeOf(status);
  return result;
}

LineProcess::LineProcess(const std::vector<std::string>& arguments, const Environment& extra) {
  std::array<int, 2> output{};
  if (pipe2(output.data(), O_CLOEXEC) != 0) return;
  pid_ = spawn(arguments, extra, output[1], -1);
  close(output[1]);
  output_ = output[0];
}

LineProcess::~LineProcess() {
  if (pid_ > 0 && !ended_) {
    kill(pid_, SIGKILL);
    waitpid(pid_, nullptr, 0);
  }
  if (output_ >= 0) close(output_);
}

std::optional<std::string> LineProcess::nextLine(steady_clock::time_point deadline) {
  for (;;) {
    const std::size_t end = buffered_.find('\n');
    if (end != std::string::npos) {
      std::string line = buffered_.substr(0, end);
      buffered_.erase(0, end + 1);
      return line;
    }
    pollfd waiting{output_, POLLIN, 0};
    if (poll(&waiting, 1, millisecondsLeft(deadline)) != 1) return std::nullopt;
    if (!drain(output_, buffered_)) return std::nullopt;
  }
}

bool LineProcess::readUntil(const std::function<bool(const std::string&)>& wanted,
                            milliseconds limit) {
  while (const auto line = nextLine(steady_clock::now() + limit)) {
    if (wanted(*line)) return true;
  }
  return false;
}

std::optional<int> LineProcess::waitForEnd(milliseconds limit) {
  const int descriptor = pidfd_open(pid_, 0);
  pollfd waiting{descriptor, POLLIN, 0};
  const bool over = poll(&waiting, 1, static_cast<int>(limit.count())) == 1;
  close(descriptor);
  int status = 0;
  if (!over || waitpid(pid_, &status, 0) != pid_) return std::nullopt;
  ended_ = true;
  return exitCodeOf(status);
}

bool eventually(const std::function<bool()>& holds, milliseconds limit) {
  const auto deadline = steady_clock::now() + limit;
  while (!holds()) {
    if (steady_clock::now() >= deadline) return false;
    poll(nullptr, 0, 5);
  }
  return true;
}

}  // namespace yomber::testing
