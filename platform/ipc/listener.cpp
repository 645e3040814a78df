#include "platform/ipc/listener.h"

#include <fcntl.h>
#include <kj/debug.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdint>
#include <map>
#include <utility>

#include "platform/foundation/log.h"
#include "platform/ipc/connection.h"

namespace yomber::ipc {

namespace {

/// How long accepting pauses when there are no descriptors left.
constexpr auto kShortagePause = 100 * kj::MILLISECONDS;
/// After so many accepted in a row the loop looks at its other work.
constexpr int kAcceptBatch = 16;

}  // namespace

struct Listener::State final : std::enable_shared_from_this<State> {
  State(std::string socketPath, Factory make, Options chosen)
      : path(std::move(socketPath)), factory(std::move(make)), options(chosen) {}

  const std::string path;
  const Factory factory;
  const Options options;
  std::atomic<std::size_t> count{0};

  // Loop thread only once started.
  UniqueFd socket;
  struct stat identity{};  ///< of the path, as bound
  kj::Own<kj::UnixEventPort::FdObserver> observer;
  kj::Maybe<kj::Promise<void>> task;
  std::map<std::uint64_t, Connection::Ref> connections;
  std::uint64_t nextConnection = 0;
  bool inShortage = false;

  void start() {
    observer = kj::heap<kj::UnixEventPort::FdObserver>(EventLoop::shared().port(), socket.get(),
                                                       kj::UnixEventPort::FdObserver::OBSERVE_READ);
    task = acceptLoop().eagerlyEvaluate([this](kj::Exception&& exception) {
      log_fault(defaultLog(), "Listening at %@ ended: %s", path, exception.getDescription().cStr());
    });
  }

  void stop() {
    task = nullptr;
    observer = nullptr;
    removePath();
    socket.reset();
    connections.clear();
    count = 0;
  }

  void removePath() const {
    struct stat now{};
    if (::lstat(path.c_str(), &now) == 0 && now.st_dev == identity.st_dev &&
        now.st_ino == identity.st_ino) {
      ::unlink(path.c_str());
    }
  }

  kj::Promise<void> acceptLoop() {
    // Observed before accepting, so that no arrival falls between the two.
    kj::Promise<void> ready = observer->whenBecomesReadable();
    for (int accepted = 0; accepted < kAcceptBatch;) {
      UniqueFd peer(::accept4(socket.get(), nullptr, nullptr, SOCK_CLOEXEC));
      const int failure = errno;
      if (peer) {
        inShortage = false;
        ++accepted;
        admit(std::move(peer));
      } else if (failure == EAGAIN) {
        return ready.then([this] { return acceptLoop(); });
      } else if (isDescriptorShortage(failure)) {
        return pause();
      } else if (failure != EINTR && failure != ECONNABORTED) {
        return KJ_EXCEPTION(FAILED, "accept failed", failure);
      }
    }
    return kj::evalLast([this] { return acceptLoop(); });
  }

  kj::Promise<void> pause() {
    if (!std::exchange(inShortage, true)) {
      log_error(defaultLog(),
                "Out of descriptors: connections to %@ wait. Raise the limit on open files.", path);
    }
    return EventLoop::shared().timer().afterDelay(kShortagePause).then([this] {
      return acceptLoop();
    });
  }

  void admit(UniqueFd peer) {
    const auto credentials = peerCredentials(peer.get());
    if (!credentials || credentials->uid != ::geteuid()) {
      log_error(defaultLog(), "Refused process %d of user %u at %@: not the drive's own user.",
                credentials ? credentials->pid : 0, credentials ? credentials->uid : 0U, path);
      return;
    }
    if (connections.size() >= options.maximumConnections) {
      log_error(defaultLog(), "Refused process %d at %@: all %zu connections are taken.",
                credentials->pid, path, options.maximumConnections);
      return;
    }
    KJ_IF_MAYBE (exception,
                 kj::runCatchingExceptions([&] { serve(std::move(peer), *credentials); })) {
      log_error(defaultLog(), "Serving process %d at %@ failed: %s", credentials->pid, path,
                exception->getDescription().cStr());
    }
  }

  void serve(UniqueFd peer, const PeerCredentials& credentials) {
    const std::uint64_t id = nextConnection++;
    Connection::Ref connection =
        Connection::accepted(std::move(peer), [&] { return factory(credentials); });
    connection->onDisconnect([weak = weak_from_this(), id](const NSErrorRef&) {
      if (const auto state = weak.lock()) state->forget(id);
    });
    connections.emplace(id, std::move(connection));
    count = connections.size();
  }

  void forget(std::uint64_t id) {
    connections.erase(id);
    count = connections.size();
  }
};

Listener::Listener(std::shared_ptr<State> state) : state_(std::move(state)) {}

std::unique_ptr<Listener> Listener::listen(const std::string& path, Factory factory,
                                           NSErrorRef* error) {
  return listen(path, std::move(factory), Options(), error);
}

std::unique_ptr<Listener> Listener::listen(const std::string& path, Factory factory,
                                           Options options, NSErrorRef* error) {
  EventLoop::shared().assertElsewhere("Listener::listen");
  auto state = std::make_shared<State>(path, std::move(factory), options);
  state->socket = listenUnixSocket(path, error);
  if (!state->socket) return nullptr;
  ::lstat(path.c_str(), &state->identity);
  EventLoop::shared().runAndWait([&] { state->start(); });
  return std::unique_ptr<Listener>(new Listener(std::move(state)));
}

Listener::~Listener() {
  EventLoop& loop = EventLoop::shared();
  if (loop.isCurrent()) {
    loop.post([state = state_] { state->stop(); });
  } else {
    loop.runAndWait([this] { state_->stop(); });
  }
}

const std::string& Listener::path() const { return state_->path; }

std::size_t Listener::connectionCount() const { return state_->count; }

}  // namespace yomber::ipc
