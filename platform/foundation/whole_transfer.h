#pragma once

#include <cstddef>
#include <cstdint>
#include <span>
#include <string_view>

namespace yomber {

// Reads and writes of which none of the bytes is left out. Both answer 0 or an errno value, and
// leave the descriptor's own position as it is.

/// Reads at `offset` until `bytes` is full or the file ends; `done` is how many there are, also
/// with an error.
[[nodiscard]] int readWhole(int file, std::span<char> bytes, std::uint64_t offset,
                            std::size_t& done);
/// Writes them all at `offset`; with an error, some may have been written.
[[nodiscard]] int writeWhole(int file, std::string_view bytes, std::uint64_t offset = 0);

}  // namespace yomber
