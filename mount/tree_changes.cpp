#include "mount/tree_changes.h"

#include <algorithm>
#include <chrono>
#include <set>
#include <utility>
#include <vector>

#include "platform/fileprovider/item_codec.h"
#include "platform/foundation/fault_points.h"
#include "platform/foundation/log.h"
#include "platform/ipc/call.h"
#include "platform/ipc/connection.h"
#include "platform/ipc/server_call.h"
#include "protocols/daemon.capnp.h"
#include "protocols/tree.capnp.h"

namespace yomber {
namespace {

FaultPoint changeTold("mount.change.told");

constexpr std::chrono::milliseconds kBetweenAttempts{300};

struct ChangedEntry {
  std::uint64_t folder = 0;
  std::string name;
};
struct Shown {
  std::uint64_t folder = 0;
  std::string name;
  std::string shownName;
  std::string location;
};

std::vector<Shown> decoded(capnp::List<protocol::ShownName>::Reader names) {
  std::vector<Shown> result;
  for (const auto name : names) {
    result.push_back({name.getFolder(), stringFromWire(name.getName()),
                      stringFromWire(name.getShownName()), stringFromWire(name.getLocation())});
  }
  return result;
}

std::vector<ChangedEntry> decoded(capnp::List<protocol::Entry>::Reader entries) {
  std::vector<ChangedEntry> result;
  for (const auto entry : entries) {
    result.push_back({entry.getFolder(), stringFromWire(entry.getName())});
  }
  return result;
}

}  // namespace

/// What outlives a connection. The capability may be called for a moment after the last one has
/// ended; from then on it does nothing.
struct TreeChanges::Link {
  Link(FileSystem& told, KernelSession& session) : files(told), updates(told, session) {}

  /// Of one connection; what an earlier one still says counts no more.
  std::uint64_t begin() {
    LockGuard guard(applying);
    return ++connection;
  }

  void start(std::uint64_t from, const std::vector<Shown>& names) {
    LockGuard guard(applying);
    if (isEnding || from != connection) return;
    updates.forgetShown();
    show(names);
    files.setIsTold(true);
    // What changed before is not told.
    updates.anythingChanged();
    updates.tellEntries();
    if (files.thumbnails() != nullptr) files.thumbnails()->noteEverything();
  }

  void change(std::uint64_t from, const std::vector<ChangedEntry>& entries,
              const std::vector<Shown>& names) {
    LockGuard guard(applying);
    if (isEnding || from != connection) return;
    show(names);
    std::set<std::uint64_t> folders;
    for (const ChangedEntry& entry : entries) {
      folders.insert(entry.folder);
      if (entry.name.empty()) {
        updates.folderChanged(entry.folder);
      } else if (entry.name != ".") {
        updates.entryChanged(entry.folder, entry.name);
      }
    }
    for (const std::uint64_t folder : folders) updates.attributesChanged(folder);
    updates.tellEntries();
  }

  void loseTrack(std::uint64_t from) {
    LockGuard guard(applying);
    if (isEnding || from != connection) return;
    files.setIsTold(false);
    updates.anythingChanged();
    updates.tellEntries();
  }

  void show(const std::vector<Shown>& names) REQUIRES(applying) {
    for (const Shown& name : names) {
      if (!name.location.empty()) {
        updates.showContainer(name.location, name.shownName);
      } else {
        updates.showName(name.folder, name.name, name.shownName);
      }
    }
  }

  FileSystem& files;
  Mutex applying;
  KernelUpdates updates GUARDED_BY(applying);
  bool isEnding GUARDED_BY(applying) = false;
  std::uint64_t connection GUARDED_BY(applying) = 0;

  /// The connection has ended, or nobody tells anything over it any more.
  void lose(std::uint64_t from) {
    LockGuard guard(mutex);
    lost = std::max(lost, from);
    changed.notifyAll();
  }

  Mutex mutex;
  Condition changed;
  std::uint64_t lost GUARDED_BY(mutex) = 0;  ///< the last connection that is
  bool isOver GUARDED_BY(mutex) = false;
};

namespace {

/// What the daemon calls. The kernel is told on a thread that may wait.
template <typename Link>
class ObserverServer final : public protocol::TreeObserver::Server {
 public:
  ObserverServer(std::shared_ptr<Link> link, std::uint64_t connection)
      : link_(std::move(link)), connection_(connection) {}
  /// The daemon has let go of it.
  ~ObserverServer() noexcept(false) { link_->lose(connection_); }
  ObserverServer(const ObserverServer&) = delete;
  ObserverServer& operator=(const ObserverServer&) = delete;

  kj::Promise<void> didStart(DidStartContext context) override {
    auto names = decoded(context.getParams().getShownNames());
    return ipc::onPool([link = link_, from = connection_, names = std::move(names)](
                           const ipc::CancelFlag&) { link->start(from, names); });
  }
  kj::Promise<void> didChange(DidChangeContext context) override {
    if (changeTold.hit()) {
      return kj::Exception(kj::Exception::Type::FAILED, __FILE__, __LINE__,
                           kj::str("changes are not taken"));
    }
    auto entries = decoded(context.getParams().getEntries());
    auto names = decoded(context.getParams().getShownNames());
    return ipc::onPool(
        [link = link_, from = connection_, entries = std::move(entries),
         names = std::move(names)](const ipc::CancelFlag&) { link->change(from, entries, names); });
  }
  kj::Promise<void> didLoseTrack(DidLoseTrackContext) override {
    return ipc::onPool(
        [link = link_, from = connection_](const ipc::CancelFlag&) { link->loseTrack(from); });
  }

 private:
  const std::shared_ptr<Link> link_;
  const std::uint64_t connection_;
};

}  // namespace

TreeChanges::TreeChanges(std::string daemonSocket, FileSystem& files, KernelSession& session)
    : daemonSocket_(std::move(daemonSocket)),
      link_(std::make_shared<Link>(files, session)),
      thread_([this] { run(); }) {}

TreeChanges::~TreeChanges() {
  {
    LockGuard guard(link_->mutex);
    link_->isOver = true;
    link_->changed.notifyAll();
  }
  thread_.join();
  LockGuard guard(link_->applying);
  link_->isEnding = true;
}

void TreeChanges::run() {
  for (;;) {
    const std::uint64_t connection = link_->begin();
    if (follow(connection)) link_->loseTrack(connection);
    LockGuard guard(link_->mutex);
    if (!link_->isOver) {
      (void)link_->changed.waitUntil(link_->mutex,
                                     std::chrono::steady_clock::now() + kBetweenAttempts);
    }
    if (link_->isOver) return;
  }
}

bool TreeChanges::follow(std::uint64_t number) {
  NSErrorRef error;
  const auto connection = ipc::Connection::connect(daemonSocket_, &error);
  if (!connection) return false;
  connection->onDisconnect([link = link_, number](const NSErrorRef&) { link->lose(number); });
  ipc::Remote<protocol::Registration> registration;
  error = ipc::callAndWait(
      connection->bootstrap<protocol::Daemon>(), &protocol::Daemon::Client::observeTreeRequest,
      [&](auto params) { params.setObserver(kj::heap<ObserverServer<Link>>(link_, number)); },
      [&](auto results) {
        registration = ipc::Remote<protocol::Registration>(results.getRegistration());
      });
  if (error) {
    log_error(defaultLog(), "[ERROR] changes of the tree are not told: %@", error);
    return false;
  }
  LockGuard guard(link_->mutex);
  while (link_->lost < number && !link_->isOver) link_->changed.wait(link_->mutex);
  return true;
}

}  // namespace yomber
