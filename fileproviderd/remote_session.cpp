#include "fileproviderd/remote_session.h"

#include <utility>

#include "fileproviderd/extension_process.h"
#include "fileproviderd/host_errors.h"
#include "fileproviderd/remote_enumerator.h"
#include "platform/fileprovider/item_codec.h"
#include "platform/foundation/log.h"
#include "platform/ipc/call.h"
#include "platform/ipc/connection.h"
#include "platform/ipc/error_codec.h"

namespace yomber {
namespace {

using protocol::Extension;
using protocol::ExtensionHost;

/// What the extension sees of the host. Events outlive it.
class HostServer final : public ExtensionHost::Server {
 public:
  explicit HostServer(std::shared_ptr<ExtensionEvents> events) : events_(std::move(events)) {}

 protected:
  kj::Promise<void> signalEnumerator(SignalEnumeratorContext context) override {
    auto container = stringFromWire(context.getParams().getContainer());
    // After the reply, so that the extension never waits for what a signal sets off.
    ipc::EventLoop::shared().post([events = events_, container = std::move(container)] {
      if (events->didSignal) events->didSignal(container);
    });
    return kj::READY_NOW;
  }

 private:
  const std::shared_ptr<ExtensionEvents> events_;
};

class RemoteSession final : public ExtensionSession,
                            public std::enable_shared_from_this<RemoteSession> {
 public:
  RemoteSession(ExtensionEvents events, std::chrono::milliseconds callLimit)
      : events_(std::make_shared<ExtensionEvents>(std::move(events))), callLimit_(callLimit) {}
  ~RemoteSession() override { *events_ = {}; }

  bool start(const ProcessLauncher::Options& options, NSErrorRef* error);

  void end() override {
    if (process_ != nullptr) process_->end();
    if (connection_ != nullptr) connection_->close();
  }
  [[nodiscard]] pid_t pid() const override { return process_->pid(); }
  [[nodiscard]] std::size_t enumeratorCount() const override {
    return static_cast<std::size_t>(enumerators_.use_count() - 1);
  }

  void locate(const std::string& identifier, std::chrono::milliseconds limit,
              AnswerHandler<std::string> handler) override;
  void identify(const std::string& path, AnswerHandler<std::string> handler) override;
  void item(const std::string& identifier, AnswerHandler<ItemFields> handler) override;
  void enumerator(const std::string& container, EnumeratorHandler handler) override;
  void openEnumerator(
      const std::string& container,
      std::function<void(ipc::Remote<protocol::Enumerator>, NSErrorRef)> handler) override;
  [[nodiscard]] ipc::Remote<protocol::Extension> remote() const override { return extension_; }

 private:
  void didEnd(const std::string& how, const NSErrorRef& underlying);
  /// What every transport failure goes through.
  std::function<void(const NSErrorRef&)> watchdog() const {
    return [events = events_](const NSErrorRef& error) {
      const bool isStuck =
          error != nullptr && error->is(NSCocoaErrorDomain, NSXPCConnectionTimedOut);
      if (isStuck && events->didTimeOut) events->didTimeOut();
    };
  }

  const std::shared_ptr<ExtensionEvents> events_;
  const std::chrono::milliseconds callLimit_;
  /// Its other owners are the enumerators that live.
  const std::shared_ptr<int> enumerators_ = std::make_shared<int>(0);
  std::shared_ptr<ExtensionProcess> process_;
  ipc::Connection::Ref connection_;
  ipc::Remote<Extension> extension_;
};

bool RemoteSession::start(const ProcessLauncher::Options& options, NSErrorRef* error) {
  ipc::UniqueFd ours;
  ipc::UniqueFd theirs;
  if (!ipc::makeSocketPair(ours, theirs, error)) return false;
  const std::weak_ptr<RemoteSession> weak = weak_from_this();
  const auto didExit = [weak](const std::string& how) {
    if (const auto self = weak.lock()) self->didEnd(how, nullptr);
  };
  process_ =
      ExtensionProcess::start(options.program, options.home, std::move(theirs), didExit, error);
  if (process_ == nullptr) return false;
  connection_ = ipc::Connection::adopt(
      ours.release(),
      [events = events_]() -> capnp::Capability::Client { return kj::heap<HostServer>(events); },
      error);
  if (connection_ == nullptr) return false;
  connection_->onDisconnect([weak](const NSErrorRef& reason) {
    if (const auto self = weak.lock()) self->didEnd("closed its connection", reason);
  });
  extension_ = connection_->bootstrap<Extension>();
  return true;
}

void RemoteSession::didEnd(const std::string& how, const NSErrorRef& underlying) {
  const auto handler = std::exchange(events_->didEnd, nullptr);
  if (handler) handler(extensionUnavailableError(how, underlying));
  end();
}

void RemoteSession::locate(const std::string& identifier, std::chrono::milliseconds limit,
                           AnswerHandler<std::string> handler) {
  (void)ipc::call(
      extension_, &Extension::Client::urlForItemRequest,
      [identifier](Extension::UrlForItemParams::Builder params) {
        params.setIdentifier(wireText(identifier));
      },
      [handler = std::move(handler), watchdog = watchdog()](
          NSErrorRef error, const Extension::UrlForItemResults::Reader* results) {
        watchdog(error);
        std::optional<std::string> path;
        if (results != nullptr && results->getPath().isValue()) {
          path = stringFromWire(results->getPath().getValue());
        }
        handler(std::move(path), std::move(error), results == nullptr);
      },
      {.timeout = limit});
}

void RemoteSession::identify(const std::string& path, AnswerHandler<std::string> handler) {
  (void)ipc::call(
      extension_, &Extension::Client::identifierForPathRequest,
      [path](Extension::IdentifierForPathParams::Builder params) {
        params.setPath(wireData(path));
      },
      [handler = std::move(handler), watchdog = watchdog()](
          NSErrorRef error, const Extension::IdentifierForPathResults::Reader* results) {
        watchdog(error);
        std::optional<std::string> identifier;
        if (results != nullptr && results->getFound()) {
          identifier = stringFromWire(results->getIdentifier());
        }
        handler(std::move(identifier), std::move(error), results == nullptr);
      },
      {.timeout = callLimit_});
}

void RemoteSession::item(const std::string& identifier, AnswerHandler<ItemFields> handler) {
  (void)ipc::call(
      extension_, &Extension::Client::itemForIdentifierRequest,
      [identifier](Extension::ItemForIdentifierParams::Builder params) {
        params.setIdentifier(wireText(identifier));
      },
      [handler = std::move(handler), watchdog = watchdog()](
          NSErrorRef error, const Extension::ItemForIdentifierResults::Reader* results) {
        watchdog(error);
        std::optional<ItemFields> item;
        if (results != nullptr) {
          const auto result = results->getResult();
          if (result.isItem()) {
            item = decodeItem(result.getItem());
          } else {
            error = ipc::decodeError(result.getError());
          }
        }
        handler(std::move(item), std::move(error), results == nullptr);
      },
      {.timeout = callLimit_});
}

void RemoteSession::openEnumerator(
    const std::string& container,
    std::function<void(ipc::Remote<protocol::Enumerator>, NSErrorRef)> handler) {
  (void)ipc::call(
      extension_, &Extension::Client::enumeratorRequest,
      [container](Extension::EnumeratorParams::Builder params) {
        params.setContainer(wireText(container));
      },
      [handler = std::move(handler), watchdog = watchdog()](
          NSErrorRef error, const Extension::EnumeratorResults::Reader* results) {
        watchdog(error);
        ipc::Remote<protocol::Enumerator> enumerator;
        if (results != nullptr) {
          const auto result = results->getResult();
          if (result.isEnumerator()) {
            enumerator = ipc::Remote<protocol::Enumerator>(result.getEnumerator());
          } else {
            error = ipc::decodeError(result.getError());
          }
        }
        handler(std::move(enumerator), std::move(error));
      },
      {.timeout = callLimit_});
}

void RemoteSession::enumerator(const std::string& container, EnumeratorHandler handler) {
  openEnumerator(container, [handler = std::move(handler), limit = callLimit_,
                             watchdog = watchdog(), count = enumerators_](
                                ipc::Remote<protocol::Enumerator> remote, NSErrorRef error) {
    if (!remote) return handler(nullptr, std::move(error));
    handler(std::make_shared<RemoteEnumerator>(std::move(remote), limit, watchdog, count), nullptr);
  });
}

}  // namespace

ExtensionSessionRef ProcessLauncher::launch(ExtensionEvents events, NSErrorRef* error) {
  auto session = std::make_shared<RemoteSession>(std::move(events), options_.callLimit);
  if (!session->start(options_, error)) return nullptr;
  log_info(defaultLog(), "[INFO] started the extension %s as process %d", options_.program.c_str(),
           session->pid());
  return session;
}

}  // namespace yomber
