// Whatever a client of a service sends: its own connection ends or goes on, and nothing else
// happens.

#include <gtest/gtest.h>

#include <cstdio>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/foundation/sanitized.h"
#include "platform/ostrell/awaited.h"
#include "platform/ostrell/collaboration_service.h"
#include "platform/ostrell/scripted_sharing.h"
#include "platform/ostrell/sharing_service.h"
#include "platform/xpc/listener.h"
#include "platform/xpc/test_hostile_peer.h"

namespace yomber {
namespace {

NSErrorRef someError() { return NSError::errorWithDomain("service", 7); }
NSProgressRef someProgress() { return NSProgress::progressWithTotalUnitCount(1); }

/// Answers at once.
class PromptSharing final : public QSSharingServiceV1 {
 public:
  void fetchSharingInfo(QSSharingInfoReply reply) override { reply(true, nullptr, nullptr); }
  NSProgressRef preflightCheckIfCurrentlyShareableWithCompletion(
      QSShareablePreflightReply completion) override {
    completion(true, nullptr, {}, {}, nullptr);
    return nullptr;
  }
  NSProgressRef fetchParticipantListAndPublicPermission(QSParticipantsReply reply) override {
    reply(scriptedShare("five")->participants(), 1, nullptr);
    return someProgress();
  }
  void startPreparingForShareWhenForcing(bool /*forcing*/) override {}
  NSProgressRef fetchShareWithCompletion(QSShareReply completion) override {
    completion(scriptedShare("five"), nullptr);
    return someProgress();
  }
  NSProgressRef fetchShareURLWithCompletion(QSShareURLReply completion) override {
    completion(nullptr, someError());
    return someProgress();
  }
  NSProgressRef saveShare(const RZShareRef& share, QSShareReply completion) override {
    completion(share, nullptr);
    return someProgress();
  }
  NSProgressRef unshareWithCompletion(QSErrorReply completion) override {
    completion(someError());
    return someProgress();
  }
};

/// Answers at once, and leaves out what the extension leaves out.
class PromptCollaboration final : public QSFileProviderPandrelCollaboration {
 public:
  void fetchVersionAndCapabilitiesWithCompletionHandler(VersionReply reply) override {
    reply(1, 82, nullptr);
  }
  NSProgressRef fetchCollaborationTokenWithCompletionHandler(TokenReply reply) override {
    reply("provider", "base", "share", NSDate::distantFuture(), nullptr);
    return someProgress();
  }
  NSProgressRef fetchLatestRevisionWithCompletionHandler(ErrorReply reply) override {
    reply(someError());
    return someProgress();
  }
  NSProgressRef fetchSharedFolderInfoWithCompletionHandler(FolderInfoReply reply) override {
    reply(true, "folder", nullptr);
    return nullptr;
  }
};

/// Exports a new object to whoever connects.
template <typename Protocol, typename Object>
class Vendor final : public NSXPCListenerDelegate {
 public:
  explicit Vendor(NSXPCInterfaceRef interface) : interface_(std::move(interface)) {}
  bool listener(const NSXPCListenerRef& /*listener*/,
                const NSXPCConnectionRef& shouldAcceptNewConnection) override {
    const auto& connection = shouldAcceptNewConnection;
    connection->setExportedInterface(interface_);
    connection->template setExportedObject<Protocol>(std::make_shared<Object>());
    connection->setInvalidationHandler([ends = ends] { ends->add(true); });
    connection->resume();
    return true;
  }
  const std::shared_ptr<Awaited<bool>> ends = std::make_shared<Awaited<bool>>();

 private:
  const NSXPCInterfaceRef interface_;
};

int roundCount() {
  // Sanitizers are ten times slower.
  if (kIsSanitized) (void)std::printf("under a sanitizer: 100 rounds instead of 1000\n");
  return kIsSanitized ? 100 : 1'000;
}

template <typename Protocol, typename Object>
void survivesMutations(const NSXPCInterfaceRef& interface,
                       const std::function<void(const NSXPCConnectionRef&)>& makeCalls) {
  using ObjectVendor = Vendor<Protocol, Object>;
  test::speakMutations(test::recordedCalls(interface, makeCalls), roundCount(),
                       [&](const std::string& bytes) {
                         const auto vendor = std::make_shared<ObjectVendor>(interface);
                         test::speakTo(vendor, bytes);
                         ASSERT_EQ(vendor->ends->wait().size(), 1U) << "the connection has ended";
                       });
}

TEST(HostileClient, DoesNothingToTheSharingService) {
  survivesMutations<QSSharingServiceV1, PromptSharing>(
      getSharingServiceInterface(), [](const NSXPCConnectionRef& client) {
        const auto proxy = client->remoteObjectProxyWithErrorHandler<QSSharingServiceV1>({});
        proxy->fetchSharingInfo({});
        proxy->preflightCheckIfCurrentlyShareableWithCompletion({});
        proxy->fetchParticipantListAndPublicPermission({})->cancel();
        proxy->startPreparingForShareWhenForcing(true);
        proxy->fetchShareWithCompletion({});
        proxy->fetchShareURLWithCompletion({});
        proxy->saveShare(scriptedShare("five"), {});
        proxy->unshareWithCompletion({})->cancel();
      });
}

TEST(HostileClient, DoesNothingToTheCollaborationService) {
  using Protocol = QSFileProviderPandrelCollaboration;
  survivesMutations<Protocol, PromptCollaboration>(
      NSXPCInterface::interfaceWithProtocol<Protocol>(), [](const NSXPCConnectionRef& client) {
        const auto proxy = client->remoteObjectProxyWithErrorHandler<Protocol>({});
        proxy->fetchVersionAndCapabilitiesWithCompletionHandler({});
        proxy->setEnvironmentType(1);
        proxy->fetchCollaborationTokenWithCompletionHandler({})->cancel();
        proxy->fetchLatestRevisionWithCompletionHandler({});
        proxy->fetchPrivacyStateWithCompletionHandler({});
        proxy->documentIsInUseWithTimeout(1.5);
        proxy->fetchSharedFolderInfoWithCompletionHandler({});
      });
}

}  // namespace
}  // namespace yomber
