#include "platform/ostrell/scripted_daemon.h"

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <stdexcept>
#include <utility>

#include "platform/fileprovider/item_codec.h"
#include "platform/ipc/error_codec.h"
#include "platform/ostrell/constants.h"
#include "platform/ostrell/daemon_connection.h"
#include "platform/ostrell/scripted_daemon_state.h"

namespace yomber {
namespace {

constexpr std::chrono::seconds kPatience{10};
/// What a test waits for may come about without anything happening here.
constexpr std::chrono::milliseconds kRetestTime{20};

/// A test cannot go on without what failed.
[[noreturn]] void giveUp(const std::string& what) {
  std::fprintf(stderr, "scripted daemon: %s: %s\n", what.c_str(), std::strerror(errno));
  std::abort();
}

std::string temporaryHome() {
  std::string path = (std::filesystem::temp_directory_path() / "yomber-scripted-XXXXXX").string();
  if (mkdtemp(path.data()) == nullptr) giveUp("no temporary directory at " + path);
  return std::filesystem::canonical(path).string();
}

int listenAt(const std::string& path) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (path.size() >= sizeof(address.sun_path)) giveUp("the socket path is too long: " + path);
  path.copy(static_cast<char*>(address.sun_path), path.size());
  const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) giveUp("no socket");
  // What ::bind takes is any address; its family says which.
  if (bind(fd, reinterpret_cast<const sockaddr*>(&address), sizeof(address)) != 0 ||
      listen(fd, SOMAXCONN) != 0) {
    giveUp("can't listen at " + path);
  }
  return fd;
}

/// Serves the accepted socket. Loop thread.
void serve(const std::shared_ptr<ScriptedDaemon::State>& state, ipc::UniqueFd socket) {
  auto connection =
      ipc::Connection::accepted(std::move(socket), [state] { return makeScriptedServer(state); });
  std::uint64_t number = 0;
  {
    LockGuard guard(state->mutex);
    number = state->nextConnection++;
    state->connections.emplace(number, connection);
    state->didHappen();
  }
  connection->onDisconnect([state, number](const NSErrorRef&) {
    LockGuard guard(state->mutex);
    state->connections.erase(number);
    state->didHappen();
  });
}

void acceptUntilShutDown(const std::shared_ptr<ScriptedDaemon::State>& state, int listener) {
  for (;;) {
    const int fd = accept4(listener, nullptr, nullptr, SOCK_CLOEXEC);
    if (fd < 0 && (errno == EINTR || errno == ECONNABORTED)) continue;
    if (fd < 0) return;
    ipc::EventLoop::shared().post(
        [state, socket = ipc::UniqueFd(fd)]() mutable { serve(state, std::move(socket)); });
  }
}

NSErrorRef noSuchFile(const std::string& what) {
  return NSError::errorWithDomain(NSCocoaErrorDomain, NSFileNoSuchFileError,
                                  {{NSFilePathErrorKey, what}});
}

ItemFields scriptedItem(std::uint64_t rawID, const std::string& filename,
                        const std::string& parentIdentifier, ItemKind kind) {
  ItemFields item;
  const auto idKind =
      kind == ItemKind::Folder ? QSFileObjectID::Kind::Folder : QSFileObjectID::Kind::Document;
  item.identifier = QSFileObjectID(idKind, rawID).asString();
  item.parentIdentifier = parentIdentifier;
  item.filename = filename;
  item.contentType = kind == ItemKind::Folder ? "inode/directory" : "text/plain";
  item.kind = kind;
  item.rawID = rawID;
  item.capabilities =
      NSFileProviderItemCapabilitiesAllowsReading | NSFileProviderItemCapabilitiesAllowsWriting;
  item.flags = protocol::ITEM_FLAG_DOWNLOADED;
  return item;
}

}  // namespace

// ---- State -------------------------------------------------------------------------------------

ScriptedDaemon::State::State(const std::string& home)
    : paths(DrivePaths::forHome(home)), locations(paths.home) {}

kj::Promise<void> ScriptedDaemon::State::answered(const std::string& method,
                                                  std::vector<std::string> arguments) {
  {
    LockGuard guard(mutex);
    calls.push_back({method, std::move(arguments)});
    didHappen();
    if (!held.contains(method) && !held.contains("*")) return kj::READY_NOW;
  }
  auto pair = kj::newPromiseAndFulfiller<void>();
  waiting[method].push_back(kj::mv(pair.fulfiller));
  return kj::mv(pair.promise);
}

ScriptedDaemon::Answers ScriptedDaemon::State::currentAnswers() {
  LockGuard guard(mutex);
  return answers;
}

kj::Promise<void> ScriptedDaemon::State::answeredUnlessDropped(const std::string& method,
                                                               std::vector<std::string> arguments) {
  auto isSent = std::make_shared<bool>(false);
  auto notice = kj::defer([state = shared_from_this(), isSent, method, arguments] {
    if (*isSent) return;
    LockGuard guard(state->mutex);
    state->calls.push_back({method + ".dropped", arguments});
    state->didHappen();
  });
  return answered(method, std::move(arguments))
      .then([isSent] { *isSent = true; })
      .attach(kj::mv(notice));
}

ScriptedSharingAnswers ScriptedDaemon::State::currentSharingAnswers() {
  LockGuard guard(mutex);
  return sharingAnswers;
}

ScriptedContentAnswers ScriptedDaemon::State::currentContentAnswers() {
  LockGuard guard(mutex);
  return contentAnswers;
}

ScriptedDaemon::Location ScriptedDaemon::State::locationOf(const std::string& identifier) {
  LockGuard guard(mutex);
  const auto found = items.find(identifier);
  if (found == items.end()) return {{}, noSuchFile(identifier)};
  return {found->second.second, nullptr};
}

ScriptedDaemon::Item ScriptedDaemon::State::itemAt(const std::string& path) {
  LockGuard guard(mutex);
  for (const auto& [identifier, entry] : items) {
    if (entry.second == path) return {entry.first, nullptr};
  }
  return {{}, noSuchFile(path)};
}

ScriptedDaemon::Item ScriptedDaemon::State::containerItem(const std::string& containerID) {
  std::string path;
  {
    LockGuard guard(mutex);
    for (const auto& each : containers) {
      if (each.containerID == containerID) path = each.documentsPath;
    }
  }
  return itemAt(path);
}

ScriptedDaemon::Page ScriptedDaemon::State::page(
    const std::function<bool(const ItemFields&)>& belongs, std::uint8_t sortOrder,
    std::uint64_t offset, std::uint32_t limit) {
  std::vector<ItemFields> all;
  {
    LockGuard guard(mutex);
    for (const auto& [identifier, entry] : items) {
      if (belongs(entry.first)) all.push_back(entry.first);
    }
  }
  std::ranges::sort(all, [sortOrder](const ItemFields& a, const ItemFields& b) {
    const auto key = [sortOrder](const ItemFields& item) {
      return std::pair(sortOrder == 0 ? 0 : item.modificationDate.nanoseconds(), item.filename);
    };
    return key(a) < key(b);
  });
  Page page;
  for (std::uint64_t i = offset; i < all.size() && page.items.size() < limit; ++i) {
    page.items.push_back(all[i]);
  }
  const std::uint64_t end = offset + page.items.size();
  page.nextOffset = end < all.size() ? end : 0;
  return page;
}

// ---- ScriptedDaemon ----------------------------------------------------------------------------

ScriptedDaemon::ScriptedDaemon() : state_(std::make_shared<State>(temporaryHome())) {
  if (const auto error = state_->paths.create()) giveUp(error->description());
  const DriveLocations& locations = state_->locations;
  for (const std::string& folder : {locations.root(), locations.trashFiles(), locations.trashInfo(),
                                    locations.promises(), locations.privateStorage()}) {
    std::filesystem::create_directories(folder);
  }
  for (const auto& containerID : {QSUbiquitousDefaultContainerID, QSUbiquitousDocumentsContainerID,
                                  QSUbiquitousDesktopContainerID}) {
    addContainer({containerID, containerID, locations.containerDocuments(containerID), "", ""});
  }
  ItemFields rootItem = scriptedFolder(1, "Documents");
  rootItem.identifier = NSFileProviderRootContainerItemIdentifier;
  rootItem.rawID = 0;
  addItem(rootItem, locations.root());
  start();
  QSDaemonConnection::setDefaultHome(home());
}

ScriptedDaemon::~ScriptedDaemon() {
  QSDaemonConnection::setDefaultHome(home());
  stop();
  ipc::EventLoop::shared().runAndWait([this] {
    state_->waiting.clear();
    // Senders that outlive this still name their receiver by its number.
    for (auto& receiver : state_->receivers) receiver = nullptr;
    state_->observers.clear();
  });
  std::error_code ignored;
  std::filesystem::remove_all(state_->paths.runtimeDirectory, ignored);
  std::filesystem::remove_all(home(), ignored);
}

const std::string& ScriptedDaemon::home() const { return state_->paths.home; }
const std::string& ScriptedDaemon::root() const { return state_->locations.root(); }

void ScriptedDaemon::script(const std::function<void(Answers& answers)>& change) {
  LockGuard guard(state_->mutex);
  change(state_->answers);
}

void ScriptedDaemon::scriptContent(
    const std::function<void(ScriptedContentAnswers& answers)>& change) {
  LockGuard guard(state_->mutex);
  change(state_->contentAnswers);
}

void ScriptedDaemon::scriptSharing(
    const std::function<void(ScriptedSharingAnswers& answers)>& change) {
  LockGuard guard(state_->mutex);
  change(state_->sharingAnswers);
}

void ScriptedDaemon::addItem(const ItemFields& item, const std::string& path) {
  LockGuard guard(state_->mutex);
  state_->items.insert_or_assign(item.identifier, std::pair(item, path));
}

void ScriptedDaemon::addContainer(const Container& container) {
  LockGuard guard(state_->mutex);
  state_->containers.push_back(container);
}

std::vector<ScriptedDaemon::Call> ScriptedDaemon::calls() const {
  LockGuard guard(state_->mutex);
  return state_->calls;
}

std::size_t ScriptedDaemon::callCount(const std::string& method) const {
  LockGuard guard(state_->mutex);
  return static_cast<std::size_t>(
      std::ranges::count(state_->calls, method, [](const Call& call) { return call.method; }));
}

void ScriptedDaemon::forgetCalls() {
  LockGuard guard(state_->mutex);
  state_->calls.clear();
}

bool ScriptedDaemon::waitForCalls(const std::string& method, std::size_t count) {
  return waitUntil([&] { return callCount(method) >= count; });
}

bool ScriptedDaemon::waitUntil(const std::function<bool()>& condition) {
  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  for (;;) {
    std::uint64_t seen = 0;
    {
      LockGuard guard(state_->mutex);
      seen = state_->events;
    }
    if (condition()) return true;
    const auto now = std::chrono::steady_clock::now();
    if (now >= deadline) return false;
    LockGuard guard(state_->mutex);
    while (state_->events == seen) {
      if (!state_->condition.waitUntil(state_->mutex, std::min(deadline, now + kRetestTime))) break;
    }
  }
}

void ScriptedDaemon::hold(const std::string& method) {
  LockGuard guard(state_->mutex);
  state_->held.insert(method);
}

void ScriptedDaemon::release(const std::string& method) {
  {
    LockGuard guard(state_->mutex);
    state_->held.erase(method);
  }
  ipc::EventLoop::shared().post([state = state_, method] {
    for (auto& [name, fulfillers] : state->waiting) {
      if (name != method && method != "*") continue;
      for (auto& each : std::exchange(fulfillers, {})) each->fulfill();
    }
  });
}

void ScriptedDaemon::dropConnections() {
  // Also those that were accepted a moment ago: they were posted before.
  ipc::EventLoop::shared().runAndWait([this] {
    std::map<std::uint64_t, ipc::Connection::Ref> connections;
    {
      LockGuard guard(state_->mutex);
      connections.swap(state_->connections);
      state_->didHappen();
    }
    for (const auto& [number, each] : connections) each->close();
  });
}

void ScriptedDaemon::stop() {
  int listener = -1;
  {
    LockGuard guard(state_->mutex);
    listener = std::exchange(state_->listener, -1);
  }
  if (listener >= 0) {
    unlink(state_->paths.daemonSocket.c_str());
    shutdown(listener, SHUT_RDWR);
    state_->acceptor.join();
    close(listener);
  }
  dropConnections();
}

void ScriptedDaemon::start() {
  const int listener = listenAt(state_->paths.daemonSocket);
  {
    LockGuard guard(state_->mutex);
    state_->listener = listener;
  }
  state_->acceptor =
      std::thread([state = state_, listener] { acceptUntilShutDown(state, listener); });
}

std::size_t ScriptedDaemon::connectionCount() const {
  LockGuard guard(state_->mutex);
  return state_->connections.size();
}

std::size_t ScriptedDaemon::subscriptionCount() const {
  LockGuard guard(state_->mutex);
  return state_->isSubscribed.size();
}

bool ScriptedDaemon::isSubscribed(std::size_t subscription) const {
  LockGuard guard(state_->mutex);
  return subscription < state_->isSubscribed.size() && state_->isSubscribed[subscription];
}

void ScriptedDaemon::sendUpdates(std::size_t subscription, const std::vector<ItemFields>& items,
                                 std::function<void(NSErrorRef)> answered) {
  ipc::EventLoop::shared().post(
      [state = state_, subscription, items, answered = std::move(answered)] {
        KJ_IF_MAYBE (receiver, state->receivers.at(subscription)) {
          auto request = receiver->receiveUpdatesRequest();
          auto list = request.initItems(static_cast<unsigned>(items.size()));
          for (unsigned i = 0; i < items.size(); ++i) encodeItem(items[i], list[i]);
          ipc::EventLoop::shared().detach(request.send().then(
              [answered](auto&&) {
                if (answered) answered(nullptr);
              },
              [answered](kj::Exception&& exception) {
                if (answered) answered(ipc::connectionError(exception));
              }));
          return;
        }
        if (answered)
          answered(ipc::connectionError(NSXPCConnectionInvalid, "no receiver any more"));
      });
}

void ScriptedDaemon::sendProgressUpdates(std::size_t subscription,
                                         const std::vector<std::string>& identifiers) {
  ipc::EventLoop::shared().post([state = state_, subscription, identifiers] {
    KJ_IF_MAYBE (receiver, state->receivers.at(subscription)) {
      auto request = receiver->receiveProgressUpdatesRequest();
      auto list = request.initIdentifiers(static_cast<unsigned>(identifiers.size()));
      for (unsigned i = 0; i < identifiers.size(); ++i) list.set(i, wireText(identifiers[i]));
      // Dropping the promise gives the call up, once it is on its way.
      auto ignored = request.send();
    }
  });
}

void ScriptedDaemon::failSender(std::size_t subscription, const NSErrorRef& error) {
  ipc::EventLoop::shared().post([state = state_, subscription, error] {
    KJ_IF_MAYBE (receiver, state->receivers.at(subscription)) {
      auto request = receiver->senderDidFailRequest();
      ipc::encodeError(error, request.initError());
      ipc::EventLoop::shared().detach(request.send().ignoreResult());
    }
  });
}

std::size_t ScriptedDaemon::observerCount() const {
  LockGuard guard(state_->mutex);
  return state_->observerCount;
}

void ScriptedDaemon::postAccountTokenDidChange() {
  ipc::EventLoop::shared().post([state = state_] {
    for (auto& [key, observer] : state->observers) {
      ipc::EventLoop::shared().detach(
          observer.accountTokenDidChangeRequest().send().ignoreResult());
    }
  });
}

void ScriptedDaemon::postContainerListDidChange() {
  ipc::EventLoop::shared().post([state = state_] {
    for (auto& [key, observer] : state->observers) {
      ipc::EventLoop::shared().detach(
          observer.containerListDidChangeRequest().send().ignoreResult());
    }
  });
}

ItemFields scriptedDocument(std::uint64_t rawID, const std::string& filename,
                            const std::string& parentIdentifier) {
  return scriptedItem(rawID, filename, parentIdentifier, ItemKind::Document);
}

ItemFields scriptedFolder(std::uint64_t rawID, const std::string& filename,
                          const std::string& parentIdentifier) {
  return scriptedItem(rawID, filename, parentIdentifier, ItemKind::Folder);
}

}  // namespace yomber
