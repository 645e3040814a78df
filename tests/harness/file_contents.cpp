#include "tests/harness/file_contents.h"

#include <fstream>
#include <iterator>

#include <sys/stat.h>

#include <gtest/gtest.h>

namespace yomber::testing {

std::string someContent(std::size_t size, std::uint32_t seed) {
  std::string content(size, '\0');
  for (char& byte : content) {
    seed = seed * 1664525U + 1013904223U;
    byte = static_cast<char>(seed >> 24U);
  }
  return content;
}

std::string contentOf(const std::string& path) {
  std::ifstream file(path, std::ios::binary);
  return {std::istreambuf_iterator<char>(file), {}};
}

std::uint64_t bytesOnDisk(const std::string& path) {
  constexpr std::uint64_t kBlock = 512;  // of st_blocks, whatever the file system's is
  struct stat status{};
  EXPECT_EQ(lstat(path.c_str(), &status), 0) << path;
  return static_cast<std::uint64_t>(status.st_blocks) * kBlock;
}

}  // namespace yomber::testing
