#include "tests/harness/terminal_process.h"

#include <array>
#include <cerrno>
#include <csignal>

#include <poll.h>
#include <pty.h>
#include <sys/wait.h>
#include <termios.h>
#include <unistd.h>

namespace yomber::testing {

TerminalProcess::TerminalProcess(const std::vector<std::string>& arguments,
                                 const Environment& extra) {
  // All of it is made ready here: between fork and exec there may be no allocation.
  std::vector<std::string> words{"/usr/bin/env"};
  for (const auto& [name, value] : extra) words.push_back(name + "=" + value);
  words.insert(words.end(), arguments.begin(), arguments.end());
  std::vector<char*> pointers;
  for (std::string& word : words) pointers.push_back(word.data());
  pointers.push_back(nullptr);

  const winsize size{.ws_row = 24, .ws_col = 100, .ws_xpixel = 0, .ws_ypixel = 0};
  termios settings{};
  cfmakeraw(&settings);  // what is printed arrives as it is
  pid_ = forkpty(&terminal_, nullptr, &settings, &size);
  if (pid_ == 0) {
    execv(pointers.front(), pointers.data());
    _exit(127);
  }
}

TerminalProcess::~TerminalProcess() {
  if (pid_ > 0) {
    kill(pid_, SIGKILL);
    waitpid(pid_, nullptr, 0);
  }
  if (terminal_ >= 0) close(terminal_);
}

bool TerminalProcess::shows(const std::string& text) {
  const auto deadline = Clock::now() + patience;
  for (;;) {
    const std::size_t found = printed_.find(text, told_);
    if (found != std::string::npos) {
      told_ = found + text.size();
      return true;
    }
    if (!readMore(deadline)) return false;
  }
}

std::optional<int> TerminalProcess::waitForEnd() {
  const auto deadline = Clock::now() + patience;
  while (readMore(deadline)) {
  }
  int status = 0;
  const auto isOver = [&] { return waitpid(pid_, &status, WNOHANG) == pid_; };
  if (!eventually(isOver)) return std::nullopt;
  pid_ = -1;
  return WIFEXITED(status) ? WEXITSTATUS(status) : -WTERMSIG(status);
}

bool TerminalProcess::readMore(Clock::time_point deadline) {
  const auto left =
      std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now()).count();
  pollfd waiting{terminal_, POLLIN, 0};
  if (left <= 0 || poll(&waiting, 1, static_cast<int>(left)) != 1) return false;
  std::array<char, 65536> bytes{};
  const ssize_t count = read(terminal_, bytes.data(), bytes.size());
  if (count > 0) printed_.append(bytes.data(), static_cast<std::size_t>(count));
  return count > 0 || (count < 0 && errno == EINTR);
}

}  // namespace yomber::testing
