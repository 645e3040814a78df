#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <list>
#include <memory>
#include <string>

#include "fileproviderd/backoff.h"
#include "fileproviderd/extension_session.h"
#include "fileproviderd/host_clock.h"

namespace yomber {

/// Whether zarn answers. Thread-safety: loop thread only.
class DaemonProbe {
 public:
  virtual ~DaemonProbe() = default;
  /// Calls `handler` within a bounded time with nil, or with why zarn cannot be had.
  virtual void probe(std::function<void(NSErrorRef)> handler) = 0;
};

/// Has the extension running whenever somebody needs it.
///
/// It is started on demand, and only when zarn answers. After the start it is asked for the root's
/// location once; as the extension computes that once and for all, one that does not know it is
/// ended and another one is started. Starts follow each other with back-off, which begins anew once
/// an extension has stayed up for a while. An extension that does not answer is ended.
///
/// Thread-safety: loop thread only.
class ExtensionSupervisor : public std::enable_shared_from_this<ExtensionSupervisor> {
 public:
  struct Limits {
    std::chrono::milliseconds acquire{8'000};  ///< the longest that `acquire` takes
    std::chrono::milliseconds answer{
        10'000};  ///< for the root's location, after the start and later
    std::chrono::milliseconds pingEvery{15'000};
    std::chrono::milliseconds stable{2'000};  ///< up for so long: the back-off begins anew
  };
  struct Events {
    std::function<void(const NSErrorRef& reason)> didEnd;  ///< an extension that was in use
    std::function<void(const std::string& container)> didSignal;
  };
  using SessionHandler = std::function<void(ExtensionSessionRef session, NSErrorRef error)>;

  /// The references must outlive it.
  ExtensionSupervisor(ExtensionLauncher& launcher, DaemonProbe& daemon, HostClock& clock,
                      Events events, Backoff::Random random, Limits limits);
  ~ExtensionSupervisor();
  ExtensionSupervisor(const ExtensionSupervisor&) = delete;
  ExtensionSupervisor& operator=(const ExtensionSupervisor&) = delete;

  /// Calls `handler` once, within a bounded time: with the running extension, or with why there is
  /// none. Calls it at once when there is one.
  void acquire(SessionHandler handler);
  /// A call on `session` failed with the connection. The extension may not have been seen to end
  /// yet: whoever acquires from now on gets the next one.
  void sessionWasLost(const ExtensionSessionRef& session, const NSErrorRef& reason);

  /// The extension took too long for something: asks it for a sign of life.
  void suspect() { ping(); }

  /// The extension in use, or nil.
  [[nodiscard]] const ExtensionSessionRef& session() const { return running_; }
  [[nodiscard]] std::uint64_t startCount() const { return startCount_; }
  /// Why there is no extension; nil while there is one and before the first attempt.
  [[nodiscard]] const NSErrorRef& lastFailure() const { return lastFailure_; }

 private:
  enum class State : std::uint8_t {
    Idle,
    Probing,   ///< asks whether zarn answers
    Starting,  ///< the process is there, its root is not known yet
    Running,
    Resting,  ///< until the next start
  };
  struct Waiter {
    SessionHandler handler;
    HostClock::TimerRef deadline;
  };
  using Waiters = std::list<Waiter>;

  void begin();
  void didProbe(const NSErrorRef& error);
  void launch();
  void didLocateRoot(bool isKnown, const NSErrorRef& error);
  void didEnd(const NSErrorRef& reason);
  void rest(const NSErrorRef& failure);
  void didRest();
  void schedulePing();
  void ping();
  void giveUpOn(const NSErrorRef& reason);
  void answerWaiters(const ExtensionSessionRef& session, const NSErrorRef& error);

  ExtensionLauncher& launcher_;
  DaemonProbe& daemon_;
  HostClock& clock_;
  const Events events_;
  const Limits limits_;
  Backoff backoff_;

  State state_ = State::Idle;
  std::uint64_t life_ = 0;  ///< of the extension that answers belong to
  ExtensionSessionRef starting_;
  ExtensionSessionRef running_;
  HostClock::TimePoint runningSince_;
  std::uint64_t startCount_ = 0;
  NSErrorRef lastFailure_;
  Waiters waiters_;
  HostClock::TimerRef restTimer_;
  HostClock::TimerRef pingTimer_;
  bool isPinging_ = false;
};

}  // namespace yomber
