#include "benchmarks/call_counter.h"

#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <array>
#include <cstdio>
#include <cstring>
#include <stdexcept>
#include <utility>

#include <capnp/rpc.capnp.h>
#include <capnp/serialize.h>

namespace yomber::bench {

namespace {

constexpr std::size_t kMaximumMessageWords = std::size_t{8} << 20U;

bool readAll(int from, void* to, std::size_t bytes) {
  auto* at = static_cast<char*>(to);
  while (bytes > 0) {
    const ssize_t count = ::read(from, at, bytes);
    if (count <= 0) return false;
    at += count;
    bytes -= static_cast<std::size_t>(count);
  }
  return true;
}

bool writeAll(int to, const void* from, std::size_t bytes) {
  const auto* at = static_cast<const char*>(from);
  while (bytes > 0) {
    const ssize_t count = ::send(to, at, bytes, MSG_NOSIGNAL);
    if (count <= 0) return false;
    at += count;
    bytes -= static_cast<std::size_t>(count);
  }
  return true;
}

/// The next message with its framing; false when the client has left or makes no sense.
bool readMessage(int from, kj::Array<capnp::word>& message) {
  message = kj::heapArray<capnp::word>(1);
  if (!readAll(from, message.begin(), sizeof(capnp::word))) return false;
  // The frame's head says how many segments there are, then how many words each has.
  while (true) {
    const std::size_t expected = capnp::expectedSizeInWordsFromPrefix(message);
    if (expected > kMaximumMessageWords) return false;
    if (expected <= message.size()) return true;
    const std::size_t have = message.size();
    auto whole = kj::heapArray<capnp::word>(expected);
    std::memcpy(whole.begin(), message.begin(), have * sizeof(capnp::word));
    message = kj::mv(whole);
    if (!readAll(from, message.begin() + have, (expected - have) * sizeof(capnp::word)))
      return false;
  }
}

bool isCall(kj::ArrayPtr<const capnp::word> message) {
  capnp::FlatArrayMessageReader reader(message);
  return reader.getRoot<capnp::rpc::Message>().isCall();
}

void copyBytes(int from, int to) {
  std::array<char, 65536> bytes{};
  ssize_t count = 0;
  while ((count = ::read(from, bytes.data(), bytes.size())) > 0) {
    if (!writeAll(to, bytes.data(), static_cast<std::size_t>(count))) break;
  }
  ::shutdown(to, SHUT_RDWR);
}

}  // namespace

CallCounter::CallCounter(std::string path) : path_(std::move(path)), movedTo_(path_ + ".moved") {
  NSErrorRef error;
  if (std::rename(path_.c_str(), movedTo_.c_str()) != 0)
    throw std::runtime_error("cannot move " + path_ + " aside");
  listening_ = ipc::listenUnixSocket(path_, &error);
  if (!listening_) throw std::runtime_error(error->description());
  acceptor_ = std::thread([this] { acceptClients(); });
}

CallCounter::~CallCounter() {
  ::shutdown(listening_.get(), SHUT_RDWR);
  acceptor_.join();
  std::vector<std::thread> threads;
  {
    LockGuard guard(mutex_);
    threads.swap(threads_);
  }
  for (std::thread& thread : threads) thread.join();
  (void)std::rename(movedTo_.c_str(), path_.c_str());
}

void CallCounter::acceptClients() {
  while (true) {
    pollfd waiting{listening_.get(), POLLIN, 0};
    ::poll(&waiting, 1, -1);
    const int client = ::accept4(listening_.get(), nullptr, nullptr, SOCK_CLOEXEC);
    if (client < 0) return;
    LockGuard guard(mutex_);
    threads_.emplace_back([this, client] { passOn(client); });
  }
}

void CallCounter::passOn(int client) {
  const ipc::UniqueFd near(client);
  const ipc::UniqueFd far = ipc::connectUnixSocket(movedTo_, nullptr);
  if (!far) return;
  std::thread back([&] { copyBytes(far.get(), near.get()); });
  kj::Array<capnp::word> message;
  while (readMessage(near.get(), message)) {
    if (isCall(message)) ++calls_;
    if (!writeAll(far.get(), message.begin(), message.size() * sizeof(capnp::word))) break;
  }
  ::shutdown(far.get(), SHUT_RDWR);
  back.join();
}

}  // namespace yomber::bench
