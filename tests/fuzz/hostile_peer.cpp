#include "tests/fuzz/hostile_peer.h"

#include <poll.h>
#include <sanitizer/allocator_interface.h>
#include <sys/socket.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <thread>
#include <vector>

#include "platform/ipc/message_stream.h"
#include "tests/fuzz/expect.h"
#include "tests/fuzz/hostile_input.h"

extern "C" std::size_t LLVMFuzzerMutate(std::uint8_t* data, std::size_t size, std::size_t maxSize);

namespace yomber::fuzz {
namespace {

/// Reads what is there; false at the end.
bool drain(int socket) {
  std::array<std::byte, 65536> buffer{};
  for (;;) {
    const ssize_t count = recv(socket, buffer.data(), buffer.size(), MSG_DONTWAIT);
    if (count == 0) return false;
    if (count < 0) return errno == EAGAIN || errno == EINTR;
  }
}

/// False when the server has hung up, or takes no more of a peer that does not read.
bool send(int socket, std::span<const std::uint8_t> bytes, std::uint8_t mode) {
  constexpr std::size_t kDroplet = 7;
  constexpr std::size_t kDropletsAtMost = 64;
  std::size_t droplets = (mode & kDroplets) != 0 ? kDropletsAtMost : 0;
  while (!bytes.empty()) {
    const std::size_t piece = droplets > 0 ? std::min(kDroplet, bytes.size()) : bytes.size();
    if (droplets > 0) --droplets;
    const ssize_t sent = ::send(socket, bytes.data(), piece, MSG_NOSIGNAL | MSG_DONTWAIT);
    if (sent >= 0) {
      bytes = bytes.subspan(static_cast<std::size_t>(sent));
      continue;
    }
    if (errno != EAGAIN || (mode & kDeaf) != 0) return false;
    pollfd ready{socket, POLLIN | POLLOUT, 0};
    (void)poll(&ready, 1, -1);
    if ((ready.revents & POLLIN) != 0 && !drain(socket)) return false;
  }
  return true;
}

void awaitEnd(int socket) {
  (void)shutdown(socket, SHUT_WR);
  pollfd ready{socket, POLLIN, 0};
  while (drain(socket)) (void)poll(&ready, 1, -1);
}

std::size_t openDescriptors() {
  return static_cast<std::size_t>(
      std::distance(std::filesystem::directory_iterator("/proc/self/fd"), {}));
}

/// Sees that nothing is left behind, now and then. The fuzzer itself keeps what it finds, and
/// caches fill up: what counts is growth beyond any of that.
class Leftovers {
 public:
  void check() {
    if (++inputs_ < kWarmUp || inputs_ % kEvery != 0) return;
    const std::size_t bytes = __sanitizer_get_current_allocated_bytes();
    const std::size_t descriptors = openDescriptors();
    if (inputs_ == kWarmUp) {
      bytes_ = bytes;
      descriptors_ = descriptors;
    }
    if (bytes > bytes_ + kMaximumGrowth || descriptors > descriptors_ + kMaximumDescriptors) {
      (void)std::fprintf(stderr, "memory went from %zu to %zu bytes, descriptors from %zu to %zu\n",
                         bytes_, bytes, descriptors_, descriptors);
      expect(false, "memory and descriptors do not grow with the connections that were served");
    }
  }

 private:
  static constexpr std::size_t kWarmUp = 512;
  static constexpr std::size_t kEvery = 128;
  static constexpr std::size_t kMaximumGrowth = std::size_t{192} * 1024 * 1024;
  static constexpr std::size_t kMaximumDescriptors = 64;
  std::size_t inputs_ = 0;
  std::size_t bytes_ = 0;
  std::size_t descriptors_ = 0;
};

}  // namespace

void attack(const Target& target, std::span<const std::uint8_t> input) {
  if (input.empty()) return;
  const std::uint8_t mode = input[0];
  const auto bytes = bytesToSend(input);
  ipc::UniqueFd socket = target.connect();
  expect(static_cast<bool>(socket), "the server takes connections");
  if (target.isPair && (mode & kNoProof) == 0) {
    expect(ipc::MessageStream::sendCredentials(socket.get()) == 0, "the handshake was sent");
  }
  const bool isTaken = send(socket.get(), bytes, mode);
  if ((mode & kPatient) != 0) target.mustAnswer();
  if (isTaken && (mode & (kAbrupt | kDeaf)) == 0) awaitEnd(socket.get());
  socket.reset();
  target.mustAnswer();
  while (target.openConnections() != 0) std::this_thread::yield();
  static Leftovers leftovers;
  leftovers.check();
}

std::size_t mutateChunk(std::span<std::uint8_t> buffer, std::size_t size, unsigned seed) {
  if (size == 0 || (buffer[0] & kFramed) == 0) return 0;
  const auto chunks = chunksOf(buffer.subspan(1, size - 1));
  if (chunks.empty()) return 0;
  const Chunk chunk = chunks[seed % chunks.size()];
  std::uint8_t* const begin = buffer.data() + 1 + chunk.begin;
  const std::size_t after = size - 1 - chunk.begin - chunk.size;
  // The length may change by what there is room for; the chunks behind it move.
  constexpr std::size_t kLongest = 0xffff;
  const std::size_t room = std::min({buffer.size() - size, std::size_t{64}, kLongest - chunk.size});
  std::vector<std::uint8_t> changed(begin, begin + chunk.size);
  changed.resize(chunk.size + room);
  changed.resize(LLVMFuzzerMutate(changed.data(), chunk.size, changed.size()));
  std::memmove(begin + changed.size(), begin + chunk.size, after);
  std::copy(changed.begin(), changed.end(), begin);
  std::uint8_t* const length = begin - kChunkLengthBytes;
  length[0] = static_cast<std::uint8_t>(changed.size() & 0xffU);
  length[1] = static_cast<std::uint8_t>(changed.size() >> 8U);
  return size - chunk.size + changed.size();
}

}  // namespace yomber::fuzz
