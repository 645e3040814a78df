#include "tests/fuzz/hostile_input.h"

#include <algorithm>
#include <array>

namespace yomber::fuzz {

std::vector<Chunk> chunksOf(std::span<const std::uint8_t> rest) {
  std::vector<Chunk> chunks;
  for (std::size_t at = 0; rest.size() - at > kChunkLengthBytes;) {
    const auto wanted = static_cast<std::size_t>(rest[at]) | static_cast<std::size_t>(rest[at + 1])
                                                                 << 8U;
    at += kChunkLengthBytes;
    const std::size_t size = std::min(wanted, rest.size() - at);
    chunks.push_back({at, size});
    at += size;
  }
  return chunks;
}

void appendChunk(std::vector<std::uint8_t>& input, std::span<const std::uint8_t> chunk) {
  input.push_back(static_cast<std::uint8_t>(chunk.size() & 0xffU));
  input.push_back(static_cast<std::uint8_t>(chunk.size() >> 8U));
  input.insert(input.end(), chunk.begin(), chunk.end());
}

void appendMessage(std::vector<std::uint8_t>& bytes, std::span<const std::uint8_t> chunk) {
  constexpr std::size_t kWordBytes = 8;
  const auto words = static_cast<std::uint32_t>((chunk.size() + kWordBytes - 1) / kWordBytes);
  const std::array<std::uint32_t, 2> header{0, words};
  const auto* const first = reinterpret_cast<const std::uint8_t*>(header.data());
  bytes.insert(bytes.end(), first, first + sizeof header);
  bytes.insert(bytes.end(), chunk.begin(), chunk.end());
  bytes.resize(bytes.size() + words * kWordBytes - chunk.size());
}

std::vector<std::uint8_t> bytesToSend(std::span<const std::uint8_t> input) {
  const auto rest = input.subspan(1);
  if ((input[0] & kFramed) == 0) return {rest.begin(), rest.end()};
  std::vector<std::uint8_t> bytes;
  for (const Chunk& chunk : chunksOf(rest)) {
    appendMessage(bytes, rest.subspan(chunk.begin, chunk.size));
  }
  return bytes;
}

}  // namespace yomber::fuzz
