#pragma once

#include <utility>

#include "platform/ostrell/collaboration_service.h"
#include "platform/xpc/served_object.h"
#include "protocols/services.capnp.h"

namespace yomber {

/// Delivers the calls of a client to the collaboration object of a connection. Loop thread only.
class CollaborationServer final : public protocol::CollaborationService::Server {
 public:
  using Object = QSFileProviderPandrelCollaboration;

  explicit CollaborationServer(ServedObject<Object> object) : object_(std::move(object)) {}

 protected:
  kj::Promise<void> fetchVersionAndCapabilities(
      FetchVersionAndCapabilitiesContext context) override;
  kj::Promise<void> setEnvironmentType(SetEnvironmentTypeContext context) override;
  kj::Promise<void> fetchCollaborationToken(FetchCollaborationTokenContext context) override;
  kj::Promise<void> fetchLatestRevision(FetchLatestRevisionContext context) override;
  kj::Promise<void> refreshSharingState(RefreshSharingStateContext context) override;
  kj::Promise<void> fetchPrivacyState(FetchPrivacyStateContext context) override;
  kj::Promise<void> documentIsInUse(DocumentIsInUseContext context) override;
  kj::Promise<void> fetchFileProviderIdentifier(
      FetchFileProviderIdentifierContext context) override;
  kj::Promise<void> fetchUrlForSharingFile(FetchUrlForSharingFileContext context) override;
  kj::Promise<void> fetchFolderSharingState(FetchFolderSharingStateContext context) override;
  kj::Promise<void> fetchSharedFolderInfo(FetchSharedFolderInfoContext context) override;

 private:
  const ServedObject<Object> object_;
};

}  // namespace yomber
