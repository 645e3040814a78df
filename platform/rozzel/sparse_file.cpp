#include "platform/rozzel/sparse_file.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>

#include "platform/foundation/whole_transfer.h"
#include "platform/rozzel/store_failure.h"

namespace yomber {

namespace {

constexpr std::size_t kBlockBytes = 4096;
constexpr std::array<std::byte, kBlockBytes> kZeroBlock{};

/// The bytes from `offset` up to the next boundary of a block.
std::size_t leadingBlock(std::span<const std::byte> bytes, std::uint64_t offset) {
  return std::min(bytes.size(), kBlockBytes - static_cast<std::size_t>(offset % kBlockBytes));
}

bool isZero(std::span<const std::byte> block) {
  return std::memcmp(block.data(), kZeroBlock.data(), block.size()) == 0;
}

}  // namespace

std::size_t readFully(int descriptor, std::span<std::byte> bytes, std::uint64_t offset) {
  std::size_t done = 0;
  errno =
      readWhole(descriptor, {reinterpret_cast<char*>(bytes.data()), bytes.size()}, offset, done);
  if (errno != 0) throwErrno("cannot read content");
  return done;
}

void writeSparsely(int descriptor, std::span<const std::byte> bytes, std::uint64_t offset) {
  while (!bytes.empty()) {
    std::size_t run = 0;  // bytes ahead that are written together
    std::size_t zeros = 0;
    while (run < bytes.size()) {
      const std::size_t block = leadingBlock(bytes.subspan(run), offset + run);
      if (isZero(bytes.subspan(run, block))) {
        zeros = block;
        break;
      }
      run += block;
    }
    errno = writeWhole(descriptor, {reinterpret_cast<const char*>(bytes.data()), run}, offset);
    if (errno != 0) throwErrno("cannot write content");
    bytes = bytes.subspan(run + zeros);
    offset += run + zeros;
  }
}

}  // namespace yomber
