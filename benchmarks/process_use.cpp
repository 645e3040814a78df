#include "benchmarks/process_use.h"

#include <fstream>
#include <sstream>
#include <stdexcept>
#include <string>

#include <unistd.h>

namespace yomber::bench {

namespace {

std::string pathOf(pid_t pid, const char* name) {
  return "/proc/" + std::to_string(pid) + "/" + name;
}

}  // namespace

double peakMebibytes(pid_t pid) {
  std::ifstream status(pathOf(pid, "status"));
  for (std::string word; status >> word;) {
    if (word != "VmHWM:") continue;
    double kibibytes = 0;
    status >> kibibytes;
    return kibibytes / 1024;
  }
  throw std::runtime_error("the memory of a process cannot be read");
}

double processorSeconds(pid_t pid) {
  std::ifstream file(pathOf(pid, "stat"));
  std::string line;
  std::getline(file, line);
  const auto name = line.rfind(')');
  if (name == std::string::npos) throw std::runtime_error("the time of a process cannot be read");
  std::istringstream rest(line.substr(name + 1));
  // State and ten numbers before the two that matter: in programs, and in the system for them.
  constexpr int kBefore = 11;
  std::string word;
  for (int i = 0; i < kBefore; ++i) rest >> word;
  double user = 0;
  double system = 0;
  rest >> user >> system;
  return (user + system) / static_cast<double>(sysconf(_SC_CLK_TCK));
}

}  // namespace yomber::bench
