#pragma once

#include <sys/socket.h>

#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <memory>
#include <string>

#include "platform/ipc/call.h"
#include "platform/ipc/connection.h"
#include "platform/ipc/listener.h"
#include "tests/fuzz/expect.h"
#include "tests/fuzz/hostile_peer.h"

namespace yomber::fuzz {

/// How long a well-behaved peer waits while another one misbehaves, on a busy machine; less than
/// the fuzzer's own time-out, so that the input is kept with the reason.
inline constexpr ipc::CallOptions kPatience{.timeout = std::chrono::milliseconds{30'000}};

inline void expectAnswer(const NSErrorRef& error) {
  if (error != nullptr) (void)std::fprintf(stderr, "%s\n", error->description().c_str());
  expect(error == nullptr, "a well-behaved peer is answered");
}

/// A listening server in this process and a well-behaved connection to it.
template <typename Interface>
class ListeningServer {
 public:
  ListeningServer(const std::string& path, ipc::Listener::Factory factory)
      : listener_(ipc::Listener::listen(path, std::move(factory))) {
    expect(listener_ != nullptr, "the server listens");
    connection_ = ipc::Connection::connect(path);
    expect(connection_ != nullptr, "the server takes a connection");
    remote = connection_->template bootstrap<Interface>();
  }

  [[nodiscard]] ipc::UniqueFd connect() const {
    return ipc::connectUnixSocket(listener_->path(), nullptr);
  }
  /// Of everybody but `remote`.
  [[nodiscard]] std::size_t otherConnections() const {
    const std::size_t count = listener_->connectionCount();
    expect(count > 0, "the well-behaved connection stays");
    return count - 1;
  }

  ipc::Remote<Interface> remote;

 private:
  const std::unique_ptr<ipc::Listener> listener_;
  ipc::Connection::Ref connection_;
};

}  // namespace yomber::fuzz

/// The fuzzer's changes, half of them within the chunks of framed inputs.
#define YOMBER_FUZZ_MUTATE_CHUNKS                                                       \
  extern "C" std::size_t LLVMFuzzerMutate(std::uint8_t*, std::size_t, std::size_t);     \
  extern "C" std::size_t LLVMFuzzerCustomMutator(std::uint8_t* data, std::size_t size,  \
                                                 std::size_t maxSize, unsigned seed) {  \
    const std::size_t changed =                                                         \
        seed % 4 == 0 ? 0 : yomber::fuzz::mutateChunk({data, maxSize}, size, seed / 4); \
    return changed != 0 ? changed : LLVMFuzzerMutate(data, size, maxSize);              \
  }
