#pragma once

#include <atomic>
#include <cstdint>
#include <string>
#include <thread>
#include <vector>

#include "platform/foundation/lock.h"
#include "platform/ipc/unix_socket.h"

namespace yomber::bench {

/// Stands in front of a server's socket and counts the calls that its clients send, as they go by
/// on the wire. Connections that were made before are not seen.
class CallCounter {
 public:
  /// Takes the place of the socket at `path`, which moves aside until this object goes.
  explicit CallCounter(std::string path);
  /// REQUIRES: its clients have ended.
  ~CallCounter();
  CallCounter(const CallCounter&) = delete;
  CallCounter& operator=(const CallCounter&) = delete;

  [[nodiscard]] std::uint64_t calls() const { return calls_; }

 private:
  void acceptClients();
  void passOn(int client);

  const std::string path_;
  const std::string movedTo_;
  ipc::UniqueFd listening_;
  std::atomic<std::uint64_t> calls_{0};
  Mutex mutex_;
  std::vector<std::thread> threads_ GUARDED_BY(mutex_);
  std::thread acceptor_;
};

}  // namespace yomber::bench
