#include "benchmarks/many_files.h"

#include <array>
#include <stdexcept>
#include <utility>

#include <fcntl.h>
#include <unistd.h>

#include "benchmarks/figure.h"
#include "tests/harness/child_process.h"

namespace yomber::bench {

void makeFiles(const std::string& folder, std::size_t count) {
  const int directory = open(folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (directory < 0) throw std::runtime_error("cannot open " + folder);
  constexpr std::array<std::pair<const char*, const char*>, 4> kinds{
      {{"report ", ".pdf"}, {"IMG_", ".jpg"}, {"Notes of day ", ".txt"}, {"draft-", ".odt"}}};
  for (std::size_t number = 0; number < count; ++number) {
    const auto& [before, after] = kinds[number % kinds.size()];
    const std::string name = before + std::to_string(number) + after;
    const int file = openat(directory, name.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0644);
    if (file < 0) throw std::runtime_error("cannot make a file in " + folder);
    if (number % 16 == 0 && ::write(file, "content", 7) != 7)
      throw std::runtime_error("cannot write in " + folder);
    close(file);
  }
  close(directory);
}

double warmFindSeconds(const std::string& directory) {
  const auto find = [&] {
    const auto result = testing::runProcess(
        {"/bin/sh", "-c", "exec find \"$0\" -printf '%p %s %T@\\n' >/dev/null", directory}, {},
        std::chrono::minutes(5));
    if (result.exitCode != 0) throw std::runtime_error("find failed: " + result.errors);
  };
  find();
  return secondsFor(find);
}

}  // namespace yomber::bench
