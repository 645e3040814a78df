#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <type_traits>
#include <utility>
#include <vector>

#include "platform/foundation/atomic_cell.h"
#include "platform/foundation/error.h"
#include "platform/foundation/lock.h"
#include "platform/foundation/serial_queue.h"
#include "platform/ipc/call.h"
#include "platform/ipc/connection.h"
#include "platform/ostrell/account.h"
#include "platform/ostrell/change_announcer.h"
#include "platform/ostrell/container.h"
#include "platform/ostrell/generation_cache.h"
#include "platform/ostrell/locations.h"
#include "protocols/daemon.capnp.h"

namespace yomber {

/// Told when the connection that it was registered with ends.
class DaemonLossObserver {
 public:
  virtual ~DaemonLossObserver() = default;
  /// Called once, on any thread; must not block.
  virtual void daemonWasLost(const NSErrorRef& reason) = 0;
};

/// One connection to the daemon that stood.
///
/// Ownership: shared by the link and by what was made over it.
class DaemonSession {
 public:
  DaemonSession(ipc::Connection::Ref connection, ipc::Remote<protocol::Daemon> daemon)
      : connection_(std::move(connection)),
        daemon_(std::move(daemon)),
        content_(ipc::Remote<protocol::Content>::Resolver(
            [daemon = daemon_] { return daemon.client().contentRequest().send().getContent(); })),
        sharing_(ipc::Remote<protocol::Sharing>::Resolver(
            [daemon = daemon_] { return daemon.client().sharingRequest().send().getSharing(); })) {}

  [[nodiscard]] const ipc::Remote<protocol::Daemon>& daemon() const { return daemon_; }
  /// Asked for when it is first called, along with that call.
  [[nodiscard]] const ipc::Remote<protocol::Content>& content() const { return content_; }
  [[nodiscard]] const ipc::Remote<protocol::Sharing>& sharing() const { return sharing_; }
  /// The one of the three whose calls `Client` makes.
  template <typename Client>
  [[nodiscard]] const auto& remote() const {
    if constexpr (std::is_same_v<Client, protocol::Content::Client>) {
      return content_;
    } else if constexpr (std::is_same_v<Client, protocol::Sharing::Client>) {
      return sharing_;
    } else {
      return daemon_;
    }
  }
  [[nodiscard]] const ipc::Connection::Ref& connection() const { return connection_; }

  /// Held weakly. Told soon when the session has ended already.
  void addLossObserver(const std::shared_ptr<DaemonLossObserver>& observer);
  /// False when it was said before.
  bool markLost() { return !isLost_.exchange(true); }
  /// Tells the observers.
  void end(const NSErrorRef& reason);
  /// Keeps the standing registration for as long as the session. Loop thread, before it is shared.
  void keep(ipc::Remote<protocol::Registration> registration) { registration_ = registration; }

 private:
  const ipc::Connection::Ref connection_;
  const ipc::Remote<protocol::Daemon> daemon_;
  const ipc::Remote<protocol::Content> content_;
  const ipc::Remote<protocol::Sharing> sharing_;
  ipc::Remote<protocol::Registration> registration_;
  std::atomic<bool> isLost_ = false;

  Mutex mutex_;
  NSErrorRef ended_ GUARDED_BY(mutex_);
  std::vector<std::weak_ptr<DaemonLossObserver>> observers_ GUARDED_BY(mutex_);
  std::size_t nextSweep_ GUARDED_BY(mutex_) = 16;
};

using DaemonSessionRef = std::shared_ptr<DaemonSession>;

/// The library's one way to the daemon of a home: connects when it is needed, and again after a
/// loss; keeps what the daemon said of account and containers until it says otherwise.
///
/// Every connection registers for the daemon's announcements before anything else is asked on it,
/// so that nothing kept can be stale. Thread-safety: every operation may be called on any thread;
/// what waits, not on the loop thread.
class DaemonLink : public std::enable_shared_from_this<DaemonLink> {
 public:
  /// The link of the process's default connection.
  static std::shared_ptr<DaemonLink> current();
  /// Ends it and puts one to the drive at `home` in its place.
  static void replaceCurrent(const std::string& home);

  static std::shared_ptr<DaemonLink> create(const std::string& home);
  DaemonLink(const DaemonLink&) = delete;
  DaemonLink& operator=(const DaemonLink&) = delete;
  virtual ~DaemonLink() = default;

  /// Gets the session, or the error that there is none.
  using SessionHandler = std::function<void(const DaemonSessionRef&, const NSErrorRef&)>;
  /// Calls `handler` at once when there is a session, else on the loop thread (or a pool thread)
  /// when the attempt that is under way, or that this starts, has ended. `handler` must not block.
  /// Handlers run in the order of the calls.
  void withSession(const SessionHandler& handler);
  /// The session, when there is one.
  [[nodiscard]] DaemonSessionRef session() const { return session_.load(); }
  /// Waits for the attempt when there is none; nil and an error when it fails.
  DaemonSessionRef waitForSession(NSErrorRef* error);

  /// Calls the daemon and waits; `decode` runs on the loop thread.
  template <typename Client, typename Params, typename Results, typename Fill, typename Decode>
  NSErrorRef callAndWait(ipc::RequestMethod<Client, Params, Results> method, Fill&& fill,
                         Decode&& decode) {
    NSErrorRef error;
    const auto session = waitForSession(&error);
    if (!session) return error;
    error = ipc::callAndWait(session->remote<Client>(), method, std::forward<Fill>(fill),
                             std::forward<Decode>(decode), callOptions_);
    if (error) noteFailure(session, error);
    return error;
  }
  /// To be told of a call that failed, before its caller is: so the caller's next call never meets
  /// the connection that has just been lost.
  void noteFailure(const DaemonSessionRef& session, const NSErrorRef& error) {
    if (error->is(NSCocoaErrorDomain, NSXPCConnectionInterrupted)) didLose(session, error);
  }

  /// From now on connects again by itself, with back-off, when the connection is lost.
  void keepConnected();
  /// Ends everything for good; later calls fail.
  void shutDown();

  [[nodiscard]] const DriveLocations& locations() const { return locations_; }
  [[nodiscard]] const ipc::CallOptions& callOptions() const { return callOptions_; }
  /// Replies, notifications and error handlers run here.
  [[nodiscard]] const std::shared_ptr<SerialQueue>& replyQueue() const { return replyQueue_; }

  using ContainerMap = std::shared_ptr<const std::map<std::string, QSContainerRef>>;
  [[nodiscard]] GenerationCache<QSAccountRef>& accountCache() { return account_; }
  [[nodiscard]] GenerationCache<ContainerMap>& containerCache() { return containers_; }

  // What the daemon announces. Loop thread.
  void accountDidChange();
  void containersDidChange();

 private:
  struct Attempt;
  struct Observer;

  explicit DaemonLink(const std::string& home, std::string socketPath);
  void attempt();
  void didConnect(ipc::Connection::Ref connection, const NSErrorRef& error);
  void checkHome(const DaemonSessionRef& session);
  void observe(const DaemonSessionRef& session);
  void didEstablish(const DaemonSessionRef& session);
  void didFail(const NSErrorRef& error);
  void didLose(const DaemonSessionRef& session, const NSErrorRef& reason);
  void tryAgainLater();
  void emptyCaches();

  const DriveLocations locations_;
  const std::string socketPath_;
  const ipc::CallOptions callOptions_;
  const std::shared_ptr<SerialQueue> replyQueue_;
  const std::shared_ptr<ChangeAnnouncer> announcer_;

  GenerationCache<QSAccountRef> account_;
  GenerationCache<ContainerMap> containers_;
  AtomicCell<DaemonSessionRef> session_;

  Mutex mutex_;
  std::vector<SessionHandler> waiting_ GUARDED_BY(mutex_);
  bool isAttempting_ GUARDED_BY(mutex_) = false;
  bool isShutDown_ GUARDED_BY(mutex_) = false;
  bool keepsConnected_ GUARDED_BY(mutex_) = false;
  bool isRetryPlanned_ GUARDED_BY(mutex_) = false;
  /// Whether observers were left without news for a while.
  bool owesAnnouncement_ GUARDED_BY(mutex_) = false;
  std::chrono::milliseconds retryDelay_ GUARDED_BY(mutex_);
};

}  // namespace yomber
