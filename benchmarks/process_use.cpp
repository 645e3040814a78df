#include "benchmarks/process_use.h"

#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <set>
#include <sstream>
#include <stdexcept>
#include <string>
#include <system_error>

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

double memoryFileMebibytes(pid_t pid) {
  constexpr double kBlockBytes = 512;  // st_blocks, whatever the file system's own are
  std::error_code gone;
  std::set<ino_t> counted;
  double bytes = 0;
  for (const auto& each : std::filesystem::directory_iterator(pathOf(pid, "fd"), gone)) {
    std::error_code closed;
    const auto target = std::filesystem::read_symlink(each.path(), closed).string();
    struct stat status{};
    if (!target.starts_with("/memfd:") || stat(each.path().c_str(), &status) != 0) continue;
    if (counted.insert(status.st_ino).second)
      bytes += kBlockBytes * static_cast<double>(status.st_blocks);
  }
  return bytes / (1 << 20);
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
