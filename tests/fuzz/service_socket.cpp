// Any bytes at a connection to a service of an item, at the extension's end: the sharing and the
// collaboration service of the real extension, with a scripted daemon behind it.

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <utility>

#include "platform/foundation/operation.h"
#include "platform/ipc/gate.h"
#include "platform/ostrell/collaboration_service.h"
#include "platform/ostrell/scripted_daemon.h"
#include "platform/ostrell/sharing_service.h"
#include "platform/xpc/connection.h"
#include "platform/xpc/listener.h"
#include "provider/extension/extension.h"
#include "provider/services/collaboration_service_source.h"
#include "provider/services/sharing_client.h"
#include "tests/fuzz/hostile_input.h"
#include "tests/fuzz/quiet_log.h"
#include "tests/fuzz/socket_target.h"

namespace yomber::fuzz {
namespace {

using Collaboration = QSFileProviderPandrelCollaboration;
using SourceRef = std::shared_ptr<ListeningServiceSource>;

constexpr const char* kIdentifier = "d:2001";

ScriptedDaemon& scriptedDaemon() {
  static ScriptedDaemon daemon;
  return daemon;
}

/// Holds the connection that its source accepts. It stays by itself, but where only the kernel's
/// queue of events leads to it, it looks like a leak.
class Keeper final : public NSXPCListenerDelegate {
 public:
  explicit Keeper(SourceRef source) : source_(std::move(source)) {}
  bool listener(const NSXPCListenerRef& listener,
                const NSXPCConnectionRef& shouldAcceptNewConnection) override {
    kept_ = shouldAcceptNewConnection;
    return source_->listener(listener, shouldAcceptNewConnection);
  }

 private:
  const SourceRef source_;
  NSXPCConnectionRef kept_;
};

/// One service: hostile clients get a source and a listener each, and a well-behaved one stays.
/// Never destroyed: threads may use it to the very end.
class Service {
 public:
  Service(std::function<SourceRef()> makeSource, NSXPCInterfaceRef interface)
      : makeSource_(std::move(makeSource)), keeper_(std::make_shared<Keeper>(makeSource_())) {
    bystander_ = NSXPCConnection::initWithListenerEndpoint(endpointFor(keeper_));
    bystander_->setRemoteObjectInterface(std::move(interface));
    bystander_->resume();
  }
  virtual ~Service() = default;
  Service(const Service&) = delete;
  Service& operator=(const Service&) = delete;

  ipc::UniqueFd connect() { return endpointFor(makeSource_())->takeSocket(); }
  /// A listener goes with the connection that it accepted, or when it will have none.
  [[nodiscard]] std::size_t openConnections() const { return listener_.expired() ? 0 : 1; }
  void mustAnswer() {
    scriptedDaemon().forgetCalls();
    ipc::Gate answered;
    call(answered);
    answered.wait();
  }

 protected:
  /// Opens the gate with the right answer, and never else.
  virtual void call(ipc::Gate& answered) = 0;
  template <typename Protocol>
  std::shared_ptr<Protocol> proxy() {
    return bystander_->remoteObjectProxyWithErrorHandler<Protocol>(
        [](const NSErrorRef& error) { expectAnswer(error); });
  }

 private:
  /// The delegate and its listener are kept until nobody else will connect, as the extension does.
  NSXPCListenerEndpointRef endpointFor(const std::shared_ptr<NSXPCListenerDelegate>& delegate) {
    const auto listener = NSXPCListener::anonymousListener();
    listener->setDelegate(delegate);
    auto endpoint = listener->endpoint();
    listener->resume();
    listener_ = listener;
    endpoint->whenSettled([delegate, listener] {
      (void)delegate;
      (void)listener;
    });
    return endpoint;
  }

  const std::function<SourceRef()> makeSource_;
  const std::shared_ptr<Keeper> keeper_;
  std::weak_ptr<NSXPCListener> listener_;  ///< the last one
  NSXPCConnectionRef bystander_;
};

class SharingUnderAttack final : public Service {
 public:
  explicit SharingUnderAttack(const std::function<SourceRef()>& makeSource)
      : Service(makeSource, getSharingServiceInterface()) {}

 private:
  void call(ipc::Gate& answered) override {
    proxy<QSSharingServiceV1>()->fetchSharingInfo(
        [&answered](bool, const NSFileProviderItemRef&, const NSErrorRef& error) {
          expect(error == nullptr, "the sharing service still answers");
          answered.open();
        });
  }
};

class CollaborationUnderAttack final : public Service {
 public:
  explicit CollaborationUnderAttack(const std::function<SourceRef()>& makeSource)
      : Service(makeSource, NSXPCInterface::interfaceWithProtocol<Collaboration>()) {}

 private:
  void call(ipc::Gate& answered) override {
    proxy<Collaboration>()->fetchFolderSharingStateWithCompletionHandler(
        [&answered](bool, const NSErrorRef& error) {
          expect(error == nullptr, "the collaboration service still answers");
          answered.open();
        });
  }
};

Target targetOf(Service& service) {
  return {.connect = [&service] { return service.connect(); },
          .isPair = true,
          .mustAnswer = [&service] { service.mustAnswer(); },
          .openConnections = [&service] { return service.openConnections(); }};
}

struct Targets {
  Target sharing;
  Target collaboration;
};

const Targets& targets() {
  quietLogs();
  auto& daemon = scriptedDaemon();
  daemon.addItem(scriptedDocument(2001, "a document"), daemon.root() + "/a document");
  const auto extension = QSFileProviderExtension::init();
  const auto queue = std::make_shared<NSOperationQueue>();
  static auto* const sharing = new SharingUnderAttack([extension, queue] {
    return QSSharingClient::initWithFileProviderExtension(extension, kIdentifier, queue);
  });
  static auto* const collaboration = new CollaborationUnderAttack([extension, queue] {
    return QSFileProviderPandrelCollaborationServiceSource::initWithFileProviderExtension(
        extension, kIdentifier, queue);
  });
  static auto* const made = new Targets{targetOf(*sharing), targetOf(*collaboration)};
  return *made;
}

}  // namespace
}  // namespace yomber::fuzz

YOMBER_FUZZ_MUTATE_CHUNKS

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace yomber::fuzz;
  static const Targets& all = targets();
  const bool isSecond = size > 0 && (data[0] & kSecondServer) != 0;
  attack(isSecond ? all.collaboration : all.sharing, {data, size});
  return 0;
}
