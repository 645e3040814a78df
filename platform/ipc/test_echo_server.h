#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "platform/foundation/lock.h"
#include "platform/ipc/call.h"
#include "platform/ipc/connection.h"
#include "platform/ipc/remote.h"
#include "platform/ipc/test_echo.capnp.h"
#include "platform/ipc/unix_socket.h"

namespace yomber::ipc::test {

/// A number that only grows, and that other threads wait for.
class Tally {
 public:
  void add();
  [[nodiscard]] std::uint64_t value() const;
  /// False when `value` was not reached within ten seconds.
  [[nodiscard]] bool waitFor(std::uint64_t value) const;

 private:
  mutable Mutex mutex_;
  mutable Condition condition_;
  std::uint64_t value_ GUARDED_BY(mutex_) = 0;
};

/// What a test sees and commands of the servers it made.
struct EchoState {
  Tally hangs;             ///< calls of `hang` that came in
  Tally cancelled;         ///< calls of `hang` that were cancelled
  Tally works;             ///< held `work` calls that the pool runs
  Tally cancelledWorks;    ///< held `work` calls that saw their flag
  Tally releaseWorks;      ///< raised to let held calls go
  Tally destroyed;         ///< servers destroyed
  Tally destroyedOffLoop;  ///< of these, on any other thread
};
using EchoStateRef = std::shared_ptr<EchoState>;

/// Makes an echo server. Loop thread only.
capnp::Capability::Client makeEcho(EchoStateRef state);
/// Makes a callback that answers its index times `factor`. Loop thread only.
Callback::Client makeCallback(std::uint64_t factor);
/// A capability that carries `descriptor`. Loop thread only.
Descriptor::Client makeDescriptor(UniqueFd descriptor);
/// A pipe's reading end that holds `text` and then ends.
UniqueFd pipeHolding(const std::string& text);
/// All that can be read from `fd`.
std::string readAll(int fd);
std::vector<std::byte> randomBytes(std::uint64_t seed, std::size_t count);

/// One `echo` of `value`; true when it came back.
bool echoes(const Remote<Echo>& echo, std::uint64_t value, CallOptions options = {});
NSErrorRef echoOnce(const Remote<Echo>& echo, CallOptions options = {});
::testing::AssertionResult isCocoaError(const NSErrorRef& error, std::int64_t code);

/// A directory of its own that is removed with what is in it.
class TemporaryDirectory {
 public:
  TemporaryDirectory();
  ~TemporaryDirectory();
  TemporaryDirectory(const TemporaryDirectory&) = delete;
  TemporaryDirectory& operator=(const TemporaryDirectory&) = delete;
  [[nodiscard]] const std::string& path() const { return path_; }
  [[nodiscard]] std::string file(const std::string& name) const { return path_ + "/" + name; }

 private:
  std::string path_;
};

/// Two connections of this process over one socket pair, the second of which serves echoes.
struct EchoPair {
  EchoPair();
  EchoStateRef state = std::make_shared<EchoState>();
  Connection::Ref client;
  Connection::Ref server;
  Remote<Echo> echo;
};

/// A process of its own that serves echoes at `path`.
class EchoProcess {
 public:
  explicit EchoProcess(const std::string& path);
  ~EchoProcess();
  EchoProcess(const EchoProcess&) = delete;
  EchoProcess& operator=(const EchoProcess&) = delete;
  void signal(int number) const;
  /// Waits until the process is stopped.
  void awaitStop() const;

 private:
  pid_t pid_ = -1;
};

}  // namespace yomber::ipc::test
