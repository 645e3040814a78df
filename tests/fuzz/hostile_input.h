#pragma once

#include <cstddef>
#include <cstdint>
#include <span>
#include <vector>

namespace yomber::fuzz {

// An input of a socket target: a byte that says how the rest is sent, and the rest.

// How the rest of an input is sent: the bits of its first byte.
inline constexpr std::uint8_t kFramed = 1;   ///< as chunks, each made a message of one segment
inline constexpr std::uint8_t kAbrupt = 2;   ///< the socket is closed without waiting for the end
inline constexpr std::uint8_t kDeaf = 4;     ///< replies are not read
inline constexpr std::uint8_t kPatient = 8;  ///< the server has time to answer before the end
inline constexpr std::uint8_t kNoProof =
    16;  ///< on a pair: the bytes come in place of the handshake
inline constexpr std::uint8_t kDroplets = 32;      ///< a few bytes at a time
inline constexpr std::uint8_t kSecondServer = 64;  ///< to the second of a target's two servers

/// Bytes of a framed input that make one message: behind their number, in 16 bits.
struct Chunk {
  std::size_t begin;
  std::size_t size;
};
inline constexpr std::size_t kChunkLengthBytes = 2;

/// The chunks of a framed input without its first byte; the last one is as long as there are bytes.
[[nodiscard]] std::vector<Chunk> chunksOf(std::span<const std::uint8_t> rest);
void appendChunk(std::vector<std::uint8_t>& input, std::span<const std::uint8_t> chunk);
/// The chunk as a message of one segment.
void appendMessage(std::vector<std::uint8_t>& bytes, std::span<const std::uint8_t> chunk);

/// What is sent.
[[nodiscard]] std::vector<std::uint8_t> bytesToSend(std::span<const std::uint8_t> input);

}  // namespace yomber::fuzz
