#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "fileproviderd/backoff.h"
#include "fileproviderd/extension_supervisor.h"
#include "fileproviderd/host_clock.h"
#include "platform/foundation/drive_paths.h"
#include "platform/ipc/connection.h"
#include "platform/ipc/remote.h"
#include "protocols/daemon.capnp.h"

namespace yomber {

/// The host's own connection to zarn: whether it answers, the signals that it raises itself, and
/// whether a folder exists. Connects again by itself, with back-off.
///
/// Thread-safety: loop thread only.
class ZarnLink final : public DaemonProbe, public std::enable_shared_from_this<ZarnLink> {
 public:
  struct Events {
    std::function<void()> didConnect;  ///< zarn is there, and signals reach us from now on
    std::function<void(const std::string& container)> didSignal;
  };
  /// `clock` must outlive it.
  ZarnLink(const DrivePaths& paths, HostClock& clock, Events events, Backoff::Random random);

  void start();
  [[nodiscard]] bool isReachable() const { return state_ == State::Connected; }

  void probe(std::function<void(NSErrorRef)> handler) override;
  /// Whether zarn says that there is no such folder, be it that the item is something else; false
  /// also when it cannot be asked.
  void isGone(const std::string& identifier, std::function<void(bool)> handler);

 private:
  enum class State : std::uint8_t { Waiting, Connecting, Connected };
  using Daemon = protocol::Daemon;

  void connect();
  void didOpen(ipc::Connection::Ref connection, const NSErrorRef& error);
  void checkHome();
  void registerForSignals();
  void didRegister();
  void lose(const NSErrorRef& reason);
  void answerProbes(const NSErrorRef& error);
  void askWhetherAlive(std::function<void(NSErrorRef)> handler);

  const std::string home_;
  const std::string socket_;
  HostClock& clock_;
  /// Shared with the capability that zarn calls.
  const std::shared_ptr<const Events> events_;
  Backoff backoff_;

  State state_ = State::Waiting;
  std::uint64_t attempt_ = 0;  ///< answers to what an earlier one asked are dropped
  ipc::Connection::Ref connection_;
  ipc::Remote<Daemon> daemon_;
  ipc::Remote<protocol::Registration> registration_;
  std::vector<std::function<void(NSErrorRef)>> probes_;
  HostClock::TimerRef timer_;
};

}  // namespace yomber
