#include "benchmarks/many_files.h"

#include <array>
#include <cstdint>
#include <random>
#include <stdexcept>
#include <utility>

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include "benchmarks/figure.h"
#include "tests/harness/child_process.h"

namespace yomber::bench {

namespace {

constexpr std::array<std::pair<const char*, const char*>, 4> kKinds{
    {{"report ", ".pdf"}, {"IMG_", ".jpg"}, {"Notes of day ", ".txt"}, {"draft-", ".odt"}}};
constexpr std::int64_t kOldest = 1'600'000'000;  // seconds since the epoch
constexpr std::uint64_t kSeconds = 100'000'000;  // from there to the newest: three years

void makeFile(int directory, std::size_t number, const timespec& date) {
  const auto& [before, after] = kKinds[number % kKinds.size()];
  const std::string name = before + std::to_string(number) + after;
  const int file = openat(directory, name.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0644);
  if (file < 0) throw std::runtime_error("cannot make the file " + name);
  const std::array<timespec, 2> times{date, date};
  const bool isWritten = number % 16 != 0 || ::write(file, "content", 7) == 7;
  const bool isDated = futimens(file, times.data()) == 0;
  close(file);
  if (!isWritten || !isDated) throw std::runtime_error("cannot fill the file " + name);
}

}  // namespace

void makeFiles(const std::string& folder, std::size_t count) {
  const int directory = open(folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (directory < 0) throw std::runtime_error("cannot open " + folder);
  std::mt19937_64 random(count);
  for (std::size_t number = 0; number < count; ++number) {
    const auto second = static_cast<std::int64_t>(random() % kSeconds);
    makeFile(directory, number, {kOldest + second, static_cast<long>(random() % 1'000'000'000)});
  }
  close(directory);
}

double findSeconds(const std::string& directory) {
  return secondsFor([&] {
    const auto result = testing::runProcess(
        {"/bin/sh", "-c", "exec find \"$0\" -printf '%p %s %T@\\n' >/dev/null", directory}, {},
        std::chrono::minutes(5));
    if (result.exitCode != 0) throw std::runtime_error("find failed: " + result.errors);
  });
}

double warmFindSeconds(const std::string& directory) {
  (void)findSeconds(directory);
  return findSeconds(directory);
}

}  // namespace yomber::bench
