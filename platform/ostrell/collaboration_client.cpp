#include <memory>
#include <utility>

#include "platform/ipc/error_codec.h"
#include "platform/ostrell/collaboration_server.h"
#include "platform/ostrell/collaboration_service.h"
#include "platform/ostrell/service_wire.h"
#include "platform/ostrell/url_wire.h"
#include "platform/xpc/interface_coding.h"
#include "platform/xpc/remote_object.h"

namespace yomber {
namespace {

using Service = protocol::CollaborationService;

class CollaborationProxy final : public QSFileProviderPandrelCollaboration {
 public:
  CollaborationProxy(NSXPCConnectionRef connection, std::function<void(NSErrorRef)> errorHandler)
      : remote_(std::move(connection), std::move(errorHandler)) {}

  void fetchVersionAndCapabilitiesWithCompletionHandler(VersionReply reply) override {
    remote_.call(
        &Service::Client::fetchVersionAndCapabilitiesRequest, kNoParameters,
        [reply = std::move(reply)](
            Service::FetchVersionAndCapabilitiesResults::Reader results) -> std::function<void()> {
          return [reply, version = results.getVersion(), capabilities = results.getCapabilities(),
                  error = ipc::decodeOptional(results.getFailure())] {
            if (reply) reply(version, capabilities, error);
          };
        });
  }

  void setEnvironmentType(std::uint64_t type) override {
    remote_.call(
        &Service::Client::setEnvironmentTypeRequest, [type](auto params) { params.setType(type); },
        [](const auto&) { return [] {}; });
  }

  NSProgressRef fetchCollaborationTokenWithCompletionHandler(TokenReply reply) override {
    return remote_.callWithProgress(
        &Service::Client::fetchCollaborationTokenRequest, kNoParameters,
        [reply = std::move(reply)](
            Service::FetchCollaborationTokenResults::Reader results) -> std::function<void()> {
          std::optional<NSDate> date;
          if (results.getExpirationDate().isValue()) {
            date = NSDate::fromNanoseconds(results.getExpirationDate().getValue());
          }
          return [reply, date, provider = decodeOptionalString(results.getProviderIdentifier()),
                  base = decodeOptionalString(results.getBaseToken()),
                  share = decodeOptionalString(results.getShareToken()),
                  error = ipc::decodeOptional(results.getFailure())] {
            if (reply) reply(provider, base, share, date, error);
          };
        });
  }

  NSProgressRef fetchLatestRevisionWithCompletionHandler(ErrorReply reply) override {
    return remote_.callWithProgress(&Service::Client::fetchLatestRevisionRequest, kNoParameters,
                                    errorReply(std::move(reply)));
  }

  NSProgressRef refreshSharingStateWithCompletionHandler(ErrorReply reply) override {
    return remote_.callWithProgress(&Service::Client::refreshSharingStateRequest, kNoParameters,
                                    errorReply(std::move(reply)));
  }

  NSProgressRef fetchPrivacyStateWithCompletionHandler(PrivacyReply reply) override {
    return remote_.callWithProgress(
        &Service::Client::fetchPrivacyStateRequest, kNoParameters,
        [reply = std::move(reply)](
            Service::FetchPrivacyStateResults::Reader results) -> std::function<void()> {
          return [reply, first = results.getFirst(), second = results.getSecond(),
                  url = decodeURL(results.getUrl()),
                  error = ipc::decodeOptional(results.getFailure())] {
            if (reply) reply(first, second, url, error);
          };
        });
  }

  void documentIsInUseWithTimeout(double timeout) override {
    remote_.call(
        &Service::Client::documentIsInUseRequest,
        [timeout](auto params) { params.setTimeout(timeout); }, [](const auto&) { return [] {}; });
  }

  void fetchFileProviderIdentifierWithCompletionHandler(StringReply reply) override {
    remote_.call(
        &Service::Client::fetchFileProviderIdentifierRequest, kNoParameters,
        [reply = std::move(reply)](
            Service::FetchFileProviderIdentifierResults::Reader results) -> std::function<void()> {
          return [reply, identifier = decodeOptionalString(results.getIdentifier()),
                  error = ipc::decodeOptional(results.getFailure())] {
            if (reply) reply(identifier, error);
          };
        });
  }

  void fetchURLForSharingFileWithCompletionHandler(URLReply reply) override {
    remote_.call(&Service::Client::fetchUrlForSharingFileRequest, kNoParameters,
                 [reply = std::move(reply)](Service::FetchUrlForSharingFileResults::Reader results)
                     -> std::function<void()> {
                   return [reply, url = decodeURL(results.getUrl()),
                           error = ipc::decodeOptional(results.getFailure())] {
                     if (reply) reply(url, error);
                   };
                 });
  }

  NSProgressRef fetchFolderSharingStateWithCompletionHandler(FolderStateReply reply) override {
    return remote_.callWithProgress(
        &Service::Client::fetchFolderSharingStateRequest, kNoParameters,
        [reply = std::move(reply)](
            Service::FetchFolderSharingStateResults::Reader results) -> std::function<void()> {
          return [reply, isInSharedFolder = results.getIsInSharedFolder(),
                  error = ipc::decodeOptional(results.getFailure())] {
            if (reply) reply(isInSharedFolder, error);
          };
        });
  }

  NSProgressRef fetchSharedFolderInfoWithCompletionHandler(FolderInfoReply reply) override {
    return remote_.callWithProgress(
        &Service::Client::fetchSharedFolderInfoRequest, kNoParameters,
        [reply = std::move(reply)](
            Service::FetchSharedFolderInfoResults::Reader results) -> std::function<void()> {
          return [reply, isInSharedFolder = results.getIsInSharedFolder(),
                  name = decodeOptionalString(results.getFolderName()),
                  error = ipc::decodeOptional(results.getFailure())] {
            if (reply) reply(isInSharedFolder, name, error);
          };
        });
  }

 private:
  const RemoteObject<Service> remote_;
};

}  // namespace

template <>
NSXPCInterfaceRef NSXPCInterface::interfaceWithProtocol<QSFileProviderPandrelCollaboration>() {
  return CodingOf<QSFileProviderPandrelCollaboration, CollaborationServer,
                  CollaborationProxy>::makeInterface();
}

}  // namespace yomber
