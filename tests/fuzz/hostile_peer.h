#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <span>

#include "platform/ipc/unix_socket.h"

namespace yomber::fuzz {

/// The server that is fuzzed.
struct Target {
  /// A connection to it. Sockets of a pair begin with the handshake.
  std::function<ipc::UniqueFd()> connect;
  bool isPair = false;
  /// Makes a call on another connection; ends the process when it is not answered.
  std::function<void()> mustAnswer;
  /// How many connections of hostile peers the server still holds.
  std::function<std::size_t()> openConnections;
};

/// Sends one input over a connection of its own, and sees that the server then closes it, answers
/// others, and has let go of everything. What never comes is left to the fuzzer's own time-out.
void attack(const Target& target, std::span<const std::uint8_t> input);

/// Changes the input of `size` bytes in `buffer` within one of its chunks and answers its new size;
/// 0 when it has none. For LLVMFuzzerCustomMutator: most changes of raw bytes end in the framing.
std::size_t mutateChunk(std::span<std::uint8_t> buffer, std::size_t size, unsigned seed);

}  // namespace yomber::fuzz
