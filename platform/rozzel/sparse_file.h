#pragma once

#include <cstddef>
#include <cstdint>
#include <span>

namespace yomber {

/// Reads until `bytes` is full or the file ends; answers how much it was. Throws StoreFailure.
[[nodiscard]] std::size_t readFully(int descriptor, std::span<std::byte> bytes,
                                    std::uint64_t offset);

/// Writes `bytes` at `offset`, leaving out blocks of zeros. Throws StoreFailure.
void writeSparsely(int descriptor, std::span<const std::byte> bytes, std::uint64_t offset);

}  // namespace yomber
