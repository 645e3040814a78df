#include "tests/harness/service_caller.h"

#include <array>
#include <tuple>
#include <utility>

#include "platform/fileprovider/errors.h"
#include "platform/ipc/gate.h"
#include "platform/ostrell/collaboration_service.h"
#include "platform/ostrell/sharing_service.h"

namespace yomber::testing {
namespace {

using Answer = ServiceCaller::Answer;
using Caller = ServiceCaller;
using Collaboration = QSFileProviderPandrelCollaboration;
using Done = ServiceCaller::Done;

template <typename Protocol>
std::shared_ptr<Protocol> proxyOf(const NSXPCConnectionRef& connection, const Done& done) {
  return connection->remoteObjectProxyWithErrorHandler<Protocol>([done](const NSErrorRef& error) {
    if (done) done({.failure = error, .error = nullptr});
  });
}
std::shared_ptr<QSSharingServiceV1> sharing(const Caller& caller, const Done& done) {
  return proxyOf<QSSharingServiceV1>(caller.sharing(), done);
}
std::shared_ptr<Collaboration> collaboration(const Caller& caller, const Done& done) {
  return proxyOf<Collaboration>(caller.collaboration(), done);
}

/// A reply whose last value is the error.
auto answered(const Done& done) {
  return [done](const auto&... values) {
    done({.failure = nullptr, .error = std::get<sizeof...(values) - 1>(std::tie(values...))});
  };
}

void fetchSharingInfo(const Caller& caller, const Done& done) {
  sharing(caller, done)->fetchSharingInfo(answered(done));
}
void preflight(const Caller& caller, const Done& done) {
  (void)sharing(caller, done)->preflightCheckIfCurrentlyShareableWithCompletion(answered(done));
}
void fetchParticipants(const Caller& caller, const Done& done) {
  (void)sharing(caller, done)->fetchParticipantListAndPublicPermission(answered(done));
}
/// It has no reply: the one after it, on the same connection, comes when it was delivered.
void startPreparing(const Caller& caller, const Done& done) {
  sharing(caller, {})->startPreparingForShareWhenForcing(true);
  fetchSharingInfo(caller, done);
}
void fetchShare(const Caller& caller, const Done& done) {
  (void)sharing(caller, done)->fetchShareWithCompletion(answered(done));
}
void fetchShareURL(const Caller& caller, const Done& done) {
  (void)sharing(caller, done)->fetchShareURLWithCompletion(answered(done));
}
void saveShare(const Caller& caller, const Done& done) {
  (void)sharing(caller, done)->saveShare(caller.share(), answered(done));
}
void unshare(const Caller& caller, const Done& done) {
  (void)sharing(caller, done)->unshareWithCompletion(answered(done));
}

void fetchVersion(const Caller& caller, const Done& done) {
  collaboration(caller, done)->fetchVersionAndCapabilitiesWithCompletionHandler(answered(done));
}
void setEnvironmentType(const Caller& caller, const Done& done) {
  collaboration(caller, done)->setEnvironmentType(1);
}
void fetchToken(const Caller& caller, const Done& done) {
  (void)collaboration(caller, done)->fetchCollaborationTokenWithCompletionHandler(answered(done));
}
void fetchLatestRevision(const Caller& caller, const Done& done) {
  (void)collaboration(caller, done)->fetchLatestRevisionWithCompletionHandler(answered(done));
}
void refreshSharingState(const Caller& caller, const Done& done) {
  (void)collaboration(caller, done)->refreshSharingStateWithCompletionHandler(answered(done));
}
void fetchPrivacyState(const Caller& caller, const Done& done) {
  (void)collaboration(caller, done)->fetchPrivacyStateWithCompletionHandler(answered(done));
}
void documentIsInUse(const Caller& caller, const Done& done) {
  collaboration(caller, done)->documentIsInUseWithTimeout(1);
}
void fetchIdentifier(const Caller& caller, const Done& done) {
  collaboration(caller, done)->fetchFileProviderIdentifierWithCompletionHandler(answered(done));
}
void fetchURLForSharingFile(const Caller& caller, const Done& done) {
  collaboration(caller, done)->fetchURLForSharingFileWithCompletionHandler(answered(done));
}
void fetchFolderState(const Caller& caller, const Done& done) {
  (void)collaboration(caller, done)->fetchFolderSharingStateWithCompletionHandler(answered(done));
}
void fetchFolderInfo(const Caller& caller, const Done& done) {
  (void)collaboration(caller, done)->fetchSharedFolderInfoWithCompletionHandler(answered(done));
}

constexpr std::array kCalls{
    Caller::Call{"fetchSharingInfo", Answer::Always, fetchSharingInfo},
    Caller::Call{"preflight", Answer::Always, preflight},
    Caller::Call{"participants", Answer::Sometimes, fetchParticipants},
    Caller::Call{"startPreparing", Answer::Always, startPreparing},
    Caller::Call{"fetchShare", Answer::Sometimes, fetchShare},
    Caller::Call{"fetchShareURL", Answer::Sometimes, fetchShareURL},
    Caller::Call{"saveShare", Answer::Sometimes, saveShare},
    Caller::Call{"unshare", Answer::Sometimes, unshare},
    Caller::Call{"fetchVersionAndCapabilities", Answer::Always, fetchVersion},
    Caller::Call{"setEnvironmentType", Answer::LeftOut, setEnvironmentType},
    Caller::Call{"fetchCollaborationToken", Answer::Sometimes, fetchToken},
    Caller::Call{"fetchLatestRevision", Answer::Always, fetchLatestRevision},
    Caller::Call{"refreshSharingState", Answer::Sometimes, refreshSharingState},
    Caller::Call{"fetchPrivacyState", Answer::LeftOut, fetchPrivacyState},
    Caller::Call{"documentIsInUse", Answer::LeftOut, documentIsInUse},
    Caller::Call{"fetchFileProviderIdentifier", Answer::Always, fetchIdentifier},
    Caller::Call{"fetchURLForSharingFile", Answer::Always, fetchURLForSharingFile},
    Caller::Call{"fetchFolderSharingState", Answer::Always, fetchFolderState},
    Caller::Call{"fetchSharedFolderInfo", Answer::Always, fetchFolderInfo},
};

NSXPCConnectionRef connectionTo(const std::vector<NSFileProviderServiceRef>& services,
                                const char* name, NSErrorRef* error) {
  for (const auto& service : services) {
    if (service->name() == name) return service->fileProviderConnection(error);
  }
  storeError(error, NSError::errorWithDomain(
                        NSCocoaErrorDomain, NSFeatureUnsupportedError,
                        {{NSLocalizedDescriptionKey, std::string("the item has no ") + name}}));
  return nullptr;
}

}  // namespace

std::span<const ServiceCaller::Call> ServiceCaller::calls() { return kCalls; }

std::unique_ptr<ServiceCaller> ServiceCaller::connect(const NSFileProviderServices& services,
                                                      const std::string& identifier,
                                                      NSErrorRef* error, const Prepare& prepare) {
  NSErrorRef failure;
  const auto all = services.servicesForItemIdentifier(identifier, &failure);
  if (failure != nullptr) {
    storeError(error, std::move(failure));
    return nullptr;
  }
  auto sharing = connectionTo(all, QSSharingServiceName, error);
  auto collaboration = sharing ? connectionTo(all, QSCollaborationServiceName, error) : nullptr;
  if (!collaboration) return nullptr;
  sharing->setRemoteObjectInterface(getSharingServiceInterface());
  collaboration->setRemoteObjectInterface(NSXPCInterface::interfaceWithProtocol<Collaboration>());
  for (const auto& connection : {sharing, collaboration}) {
    if (prepare) prepare(*connection);
    connection->resume();
  }
  return std::unique_ptr<ServiceCaller>(
      new ServiceCaller(std::move(sharing), std::move(collaboration)));
}

ServiceCaller::ServiceCaller(NSXPCConnectionRef sharing, NSXPCConnectionRef collaboration)
    : sharing_(std::move(sharing)), collaboration_(std::move(collaboration)) {}

ServiceCaller::~ServiceCaller() {
  sharing_->invalidate();
  collaboration_->invalidate();
}

ServiceCallEnd ServiceCaller::fetchShare() {
  ServiceCallEnd end;
  ipc::Gate ended;
  (void)proxyOf<QSSharingServiceV1>(sharing_, [&](const ServiceCallEnd& failed) {
    end = failed;
    ended.open();
  })->fetchShareWithCompletion([&](const RZShareRef& share, const NSErrorRef& error) {
    share_ = share;
    end.error = error;
    ended.open();
  });
  ended.wait();
  return end;
}

ServiceCallEnd ServiceCaller::waitForAnswer() const {
  ServiceCallEnd end;
  ipc::Gate ended;
  fetchVersion(*this, [&](const ServiceCallEnd& it) {
    end = it;
    ended.open();
  });
  ended.wait();
  return end;
}

void ServiceCallEnds::callEverything(const ServiceCaller& caller,
                                     const std::function<void()>& each) {
  for (std::size_t call = 0; call < kCalls.size(); ++call) {
    kCalls[call].begin(caller, [self = shared_from_this(), call, each](const ServiceCallEnd& end) {
      {
        LockGuard guard(self->mutex_);
        self->ends_[call].push_back(end);
      }
      if (each) each();
    });
  }
}

std::size_t ServiceCallEnds::count() const {
  LockGuard guard(mutex_);
  std::size_t count = 0;
  for (const auto& each : ends_) count += each.size();
  return count;
}

std::vector<ServiceCallEnd> ServiceCallEnds::of(std::size_t call) const {
  LockGuard guard(mutex_);
  return ends_[call];
}

}  // namespace yomber::testing
