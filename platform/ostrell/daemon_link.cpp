#include "platform/ostrell/daemon_link.h"

#include <algorithm>

#include "platform/fileprovider/file_operations.h"
#include "platform/fileprovider/item_codec.h"
#include "platform/fileprovider/wire_item.h"
#include "platform/foundation/drive_paths.h"
#include "platform/ipc/gate.h"
#include "platform/ostrell/daemon_question.h"
#include "platform/ostrell/daemon_wire.h"
#include "platform/ostrell/errors.h"
#include "platform/ostrell/exclusions.h"
#include "platform/ostrell/item_additions.h"
#include "platform/ostrell/record_store.h"
#include "platform/ostrell/trash_info.h"

namespace yomber {
namespace {

using std::chrono::milliseconds;

constexpr milliseconds kFirstRetryDelay{20};
constexpr milliseconds kLongestRetryDelay{2'000};

NSErrorRef wrongHome(const std::string& socketPath, const std::string& theirs,
                     const std::string& ours) {
  return ipc::connectionError(NSXPCConnectionInvalid,
                              "The daemon at " + socketPath + " serves the drive at " + theirs +
                                  ", not the one at " + ours +
                                  ". End it with \"yomber down\", or set YOMBER_HOME.");
}

/// Where `current` keeps the link: never destroyed, since threads may use it to the very end.
AtomicCell<std::shared_ptr<DaemonLink>>& currentLink() {
  static auto* const cell = new AtomicCell<std::shared_ptr<DaemonLink>>(
      DaemonLink::create(DrivePaths::forDefaultHome().home));
  return *cell;
}

}  // namespace

/// What the daemon tells of account and containers.
struct DaemonLink::Observer final : protocol::LibraryObserver::Server {
  explicit Observer(std::weak_ptr<DaemonLink> owner) : link(std::move(owner)) {}

  kj::Promise<void> accountTokenDidChange(AccountTokenDidChangeContext) override {
    if (const auto strong = link.lock()) strong->accountDidChange();
    return kj::READY_NOW;
  }
  kj::Promise<void> containerListDidChange(ContainerListDidChangeContext) override {
    if (const auto strong = link.lock()) strong->containersDidChange();
    return kj::READY_NOW;
  }

  const std::weak_ptr<DaemonLink> link;
};

// ---- DaemonSession -----------------------------------------------------------------------------

void DaemonSession::addLossObserver(const std::shared_ptr<DaemonLossObserver>& observer) {
  NSErrorRef ended;
  {
    LockGuard guard(mutex_);
    if (observers_.size() >= nextSweep_) {
      std::erase_if(observers_, [](const auto& each) { return each.expired(); });
      nextSweep_ = std::max<std::size_t>(16, observers_.size() * 2);
    }
    if (!ended_) observers_.push_back(observer);
    ended = ended_;
  }
  if (!ended) return;
  ipc::EventLoop::shared().post(
      [observer, ended = std::move(ended)] { observer->daemonWasLost(ended); });
}

void DaemonSession::end(const NSErrorRef& reason) {
  std::vector<std::weak_ptr<DaemonLossObserver>> observers;
  {
    LockGuard guard(mutex_);
    ended_ = reason;
    observers.swap(observers_);
  }
  for (const auto& each : observers) {
    if (const auto observer = each.lock()) observer->daemonWasLost(reason);
  }
}

// ---- DaemonLink --------------------------------------------------------------------------------

std::shared_ptr<DaemonLink> DaemonLink::current() { return currentLink().load(); }

void DaemonLink::replaceCurrent(const std::string& home) {
  const auto previous = currentLink().exchange(create(home));
  previous->shutDown();
}

std::shared_ptr<DaemonLink> DaemonLink::create(const std::string& home) {
  registerItemsInErrors();
  setPhysicalLocationResolver([](const NSURLRef& logical) { return qs_physicalURL(logical); });
  setFormerNameResolver(trashedName);
  setDepartureRule(qs_isExcludedMove);
  const DrivePaths paths = DrivePaths::forHome(home);
  setStagingFolder(paths.privateDirectory + "/copies");
  installRecordStore(paths.store);
  return std::shared_ptr<DaemonLink>(new DaemonLink(paths.home, paths.daemonSocket));
}

DaemonLink::DaemonLink(const std::string& home, std::string socketPath)
    : locations_(home),
      socketPath_(std::move(socketPath)),
      callOptions_{daemonTimeLimit()},
      replyQueue_(SerialQueue::create("qs-daemon-replies")),
      announcer_(std::make_shared<ChangeAnnouncer>()),
      retryDelay_(kFirstRetryDelay) {}

void DaemonLink::withSession(const SessionHandler& handler) {
  DaemonSessionRef session = session_.load();
  NSErrorRef error;
  bool isFirst = false;
  if (!session) {
    LockGuard guard(mutex_);
    session = session_.load();
    if (isShutDown_) {
      error = ipc::connectionError(NSXPCConnectionInvalid, "The daemon's connection was ended.");
    } else if (!session) {
      waiting_.push_back(handler);
      isFirst = !std::exchange(isAttempting_, true);
    }
  }
  if (session || error) {
    handler(session, error);
  } else if (isFirst) {
    attempt();
  }
}

DaemonSessionRef DaemonLink::waitForSession(NSErrorRef* error) {
  if (auto session = session_.load()) return session;
  ipc::EventLoop::shared().assertElsewhere("waiting for the daemon");
  DaemonSessionRef result;
  ipc::Gate done;
  withSession([&](const DaemonSessionRef& session, const NSErrorRef& failure) {
    result = session;
    storeError(error, failure);
    done.open();
  });
  done.wait();
  return result;
}

void DaemonLink::attempt() {
  ipc::Connection::connectAsync(
      socketPath_, [self = shared_from_this()](ipc::Connection::Ref connection, NSErrorRef error) {
        self->didConnect(std::move(connection), error);
      });
}

void DaemonLink::didConnect(ipc::Connection::Ref connection, const NSErrorRef& error) {
  if (error || !connection) {
    didFail(error);
    return;
  }
  auto daemon = connection->bootstrap<protocol::Daemon>();
  checkHome(std::make_shared<DaemonSession>(std::move(connection), std::move(daemon)));
}

void DaemonLink::checkHome(const DaemonSessionRef& session) {
  using Results = protocol::Daemon::DescribeResults;
  auto onReply = [self = shared_from_this(), session](NSErrorRef error,
                                                      const Results::Reader* results) {
    std::string home;
    if (results != nullptr) {
      error = whatIsWrongWith([&] { home = stringFromWire(results->getHome()); });
    }
    if (!error && home != self->locations_.home()) {
      error = wrongHome(self->socketPath_, home, self->locations_.home());
    }
    if (error) {
      self->didFail(error);
    } else {
      self->observe(session);
    }
  };
  (void)ipc::call(
      session->daemon(), &protocol::Daemon::Client::describeRequest, [](auto) {},
      std::move(onReply), callOptions_);
}

void DaemonLink::observe(const DaemonSessionRef& session) {
  using Results = protocol::Daemon::ObserveResults;
  using Params = protocol::Daemon::ObserveParams;
  auto onReply = [self = shared_from_this(), session](NSErrorRef error,
                                                      const Results::Reader* results) {
    if (results != nullptr) {
      error = whatIsWrongWith(
          [&] { session->keep(ipc::Remote<protocol::Registration>(results->getRegistration())); });
    }
    if (error) {
      self->didFail(error);
    } else {
      self->didEstablish(session);
    }
  };
  (void)ipc::call(
      session->daemon(), &protocol::Daemon::Client::observeRequest,
      [weak = weak_from_this()](Params::Builder params) {
        params.setObserver(kj::heap<Observer>(weak));
      },
      std::move(onReply), callOptions_);
}

/// On the loop thread, so that no loss comes in between.
void DaemonLink::didEstablish(const DaemonSessionRef& session) {
  bool owesAnnouncement = false;
  bool isShutDown = false;
  for (std::vector<SessionHandler> ready;; ready.clear()) {
    {
      LockGuard guard(mutex_);
      isShutDown = isShutDown_;
      // Only once all that waited has gone ahead may others call directly, or they would overtake.
      if (waiting_.empty()) {
        if (!isShutDown) session_.store(session);
        isAttempting_ = false;
        retryDelay_ = kFirstRetryDelay;
        owesAnnouncement = std::exchange(owesAnnouncement_, false);
        break;
      }
      ready.swap(waiting_);
    }
    for (const auto& handler : ready) handler(session, nullptr);
  }
  // Weakly, or the connection would keep itself open.
  session->connection()->onDisconnect(
      [weak = weak_from_this(),
       weakSession = std::weak_ptr<DaemonSession>(session)](const NSErrorRef& reason) {
        const auto lost = weakSession.lock();
        if (!lost) return;
        if (const auto self = weak.lock()) {
          self->didLose(lost, reason);
        } else {
          lost->end(reason);
        }
      });
  if (isShutDown) {
    session->connection()->close();
  } else if (owesAnnouncement) {
    announcer_->accountDidChange();
    announcer_->containersDidChange();
  }
}

void DaemonLink::didFail(const NSErrorRef& error) {
  std::vector<SessionHandler> failed;
  {
    LockGuard guard(mutex_);
    failed.swap(waiting_);
    isAttempting_ = false;
    owesAnnouncement_ = true;
  }
  for (const auto& handler : failed) handler(nullptr, error);
  tryAgainLater();
}

void DaemonLink::didLose(const DaemonSessionRef& session, const NSErrorRef& reason) {
  if (!session->markLost()) return;
  {
    LockGuard guard(mutex_);
    if (session_.load() == session) session_.store(nullptr);
    owesAnnouncement_ = true;
  }
  emptyCaches();
  session->end(reason);
  session->connection()->close();
  tryAgainLater();
}

void DaemonLink::emptyCaches() {
  account_.empty();
  containers_.empty();
}

void DaemonLink::keepConnected() {
  {
    LockGuard guard(mutex_);
    if (std::exchange(keepsConnected_, true) || isShutDown_ || isAttempting_) return;
  }
  withSession([](const DaemonSessionRef&, const NSErrorRef&) {});
}

void DaemonLink::tryAgainLater() {
  milliseconds delay{};
  {
    LockGuard guard(mutex_);
    if (!keepsConnected_ || isShutDown_ || std::exchange(isRetryPlanned_, true)) return;
    delay = retryDelay_;
    retryDelay_ = std::min(retryDelay_ * 2, kLongestRetryDelay);
  }
  ipc::EventLoop::shared().post([weak = weak_from_this(), delay] {
    auto& loop = ipc::EventLoop::shared();
    loop.detach(loop.timer().afterDelay(delay.count() * kj::MILLISECONDS).then([weak] {
      const auto self = weak.lock();
      if (!self) return;
      {
        LockGuard guard(self->mutex_);
        self->isRetryPlanned_ = false;
      }
      self->withSession([](const DaemonSessionRef&, const NSErrorRef&) {});
    }));
  });
}

void DaemonLink::shutDown() {
  {
    LockGuard guard(mutex_);
    isShutDown_ = true;
  }
  announcer_->stop();
  if (const auto session = session_.load()) session->connection()->close();
}

void DaemonLink::accountDidChange() {
  account_.empty();
  announcer_->accountDidChange();
}

void DaemonLink::containersDidChange() {
  containers_.empty();
  announcer_->containersDidChange();
}

}  // namespace yomber
