#include "fileproviderd/zarn_link.h"

#include <utility>

#include "fileproviderd/host_errors.h"
#include "platform/fileprovider/item_codec.h"
#include "platform/foundation/log.h"
#include "platform/ipc/call.h"
#include "platform/ipc/error_codec.h"

namespace yomber {
namespace {

/// zarn answers these from memory.
constexpr ipc::CallOptions kShortly{.timeout = std::chrono::milliseconds{3'000}};
constexpr std::chrono::milliseconds kLongestRetry{1'000};
constexpr std::chrono::milliseconds kFirstRetry{50};

NSErrorRef otherHomeError(const std::string& home) {
  return NSError::errorWithDomain(
      NSCocoaErrorDomain, NSXPCConnectionInvalid,
      {{NSLocalizedDescriptionKey, "the zarn that answers here serves another drive, at " + home +
                                       ": run 'yomber down' there, "
                                       "or use that home"}});
}

/// What an item is never changes, and its identifier says it.
bool isFolder(const std::string& identifier) { return identifier.starts_with("i:"); }

/// What zarn calls.
class SignalReceiver final : public protocol::HostReceiver::Server {
 public:
  explicit SignalReceiver(std::shared_ptr<const ZarnLink::Events> events)
      : events_(std::move(events)) {}

 protected:
  kj::Promise<void> signalEnumerator(SignalEnumeratorContext context) override {
    if (events_->didSignal) {
      events_->didSignal(stringFromWire(context.getParams().getContainer()));
    }
    return kj::READY_NOW;
  }

 private:
  const std::shared_ptr<const ZarnLink::Events> events_;
};

}  // namespace

ZarnLink::ZarnLink(const DrivePaths& paths, HostClock& clock, Events events, Backoff::Random random)
    : home_(paths.home),
      socket_(paths.daemonSocket),
      clock_(clock),
      events_(std::make_shared<const Events>(std::move(events))),
      backoff_(std::move(random), kFirstRetry, kLongestRetry) {}

void ZarnLink::start() { connect(); }

void ZarnLink::probe(std::function<void(NSErrorRef)> handler) {
  if (state_ == State::Connected) return askWhetherAlive(std::move(handler));
  probes_.push_back(std::move(handler));
  if (state_ == State::Waiting) connect();
}

void ZarnLink::askWhetherAlive(std::function<void(NSErrorRef)> handler) {
  (void)ipc::call(
      daemon_, &Daemon::Client::describeRequest, [](Daemon::DescribeParams::Builder) {},
      [handler = std::move(handler)](const NSErrorRef& error,
                                     const Daemon::DescribeResults::Reader* /*results*/) {
        handler(error != nullptr ? zarnNotRunningError(error) : nullptr);
      },
      kShortly);
}

void ZarnLink::isGone(const std::string& identifier, std::function<void(bool)> handler) {
  if (state_ != State::Connected) {
    return ipc::EventLoop::shared().post([handler = std::move(handler)] { handler(false); });
  }
  (void)ipc::call(
      daemon_, &Daemon::Client::urlForItemIdentifierRequest,
      [identifier](Daemon::UrlForItemIdentifierParams::Builder params) {
        params.setIdentifier(wireText(identifier));
      },
      [identifier, handler = std::move(handler)](
          const NSErrorRef& /*error*/, const Daemon::UrlForItemIdentifierResults::Reader* results) {
        if (results == nullptr) return handler(false);
        const auto result = results->getResult();
        handler(result.isError() ? isNoSuchItemError(ipc::decodeError(result.getError()))
                                 : !isFolder(identifier));
      },
      kShortly);
}

void ZarnLink::connect() {
  state_ = State::Connecting;
  timer_.reset();
  ++attempt_;
  ipc::Connection::connectAsync(socket_, [weak = weak_from_this(), attempt = attempt_](
                                             ipc::Connection::Ref connection, NSErrorRef error) {
    ipc::EventLoop::shared().post(
        [weak, attempt, connection = std::move(connection), error = std::move(error)]() mutable {
          const auto self = weak.lock();
          if (self == nullptr || self->attempt_ != attempt) return;
          self->didOpen(std::move(connection), error);
        });
  });
}

void ZarnLink::didOpen(ipc::Connection::Ref connection, const NSErrorRef& error) {
  if (connection == nullptr) return lose(zarnNotRunningError(error));
  connection_ = std::move(connection);
  daemon_ = connection_->bootstrap<Daemon>();
  connection_->onDisconnect(
      [weak = weak_from_this(), attempt = attempt_](const NSErrorRef& reason) {
        const auto self = weak.lock();
        if (self != nullptr && self->attempt_ == attempt) self->lose(zarnNotRunningError(reason));
      });
  checkHome();
}

void ZarnLink::checkHome() {
  (void)ipc::call(
      daemon_, &Daemon::Client::describeRequest, [](Daemon::DescribeParams::Builder) {},
      [weak = weak_from_this(), attempt = attempt_](
          const NSErrorRef& error, const Daemon::DescribeResults::Reader* results) {
        const auto self = weak.lock();
        if (self == nullptr || self->attempt_ != attempt) return;
        if (results == nullptr) return self->lose(zarnNotRunningError(error));
        const auto home = stringFromWire(results->getHome());
        if (home != self->home_) return self->lose(otherHomeError(home));
        self->registerForSignals();
      },
      kShortly);
}

void ZarnLink::registerForSignals() {
  (void)ipc::call(
      daemon_, &Daemon::Client::registerHostRequest,
      [events = events_](Daemon::RegisterHostParams::Builder params) {
        params.setHost(kj::heap<SignalReceiver>(events));
      },
      [weak = weak_from_this(), attempt = attempt_](
          const NSErrorRef& error, const Daemon::RegisterHostResults::Reader* results) {
        const auto self = weak.lock();
        if (self == nullptr || self->attempt_ != attempt) return;
        if (results == nullptr) return self->lose(zarnNotRunningError(error));
        self->registration_ = ipc::Remote<protocol::Registration>(results->getRegistration());
        self->didRegister();
      },
      kShortly);
}

void ZarnLink::didRegister() {
  log_info(defaultLog(), "[INFO] connected to zarn");
  state_ = State::Connected;
  backoff_.reset();
  answerProbes(nullptr);
  if (events_->didConnect) events_->didConnect();
}

void ZarnLink::lose(const NSErrorRef& reason) {
  if (state_ == State::Connected) log_default(defaultLog(), "[NOTICE] %@", reason);
  ++attempt_;
  state_ = State::Waiting;
  registration_ = nullptr;
  daemon_ = nullptr;
  connection_ = nullptr;
  timer_ = clock_.after(backoff_.next(), [weak = weak_from_this()] {
    if (const auto self = weak.lock()) self->connect();
  });
  answerProbes(reason);
}

void ZarnLink::answerProbes(const NSErrorRef& error) {
  for (const auto& handler : std::exchange(probes_, {})) handler(error);
}

}  // namespace yomber
