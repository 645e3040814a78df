#include "platform/foundation/process_usage.h"

#include <unistd.h>

#include <filesystem>
#include <fstream>

namespace yomber {

ProcessUsage processUsage() {
  ProcessUsage usage;
  std::uint64_t totalPages = 0;
  std::uint64_t residentPages = 0;
  std::ifstream statm("/proc/self/statm");
  if (statm >> totalPages >> residentPages) {
    usage.residentBytes = residentPages * static_cast<std::uint64_t>(sysconf(_SC_PAGESIZE));
  }
  std::error_code error;
  for (std::filesystem::directory_iterator entry("/proc/self/fd", error), end;
       !error && entry != end; entry.increment(error)) {
    ++usage.openDescriptors;
  }
  // One of them is the directory that was read.
  if (usage.openDescriptors > 0) --usage.openDescriptors;
  return usage;
}

}  // namespace yomber
