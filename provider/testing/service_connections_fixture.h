#pragma once

#include <cstdint>
#include <memory>

#include "platform/ostrell/awaited.h"
#include "platform/ostrell/collaboration_service.h"
#include "platform/ostrell/sharing_service.h"
#include "platform/xpc/connection.h"
#include "provider/services/collaboration_service_source.h"
#include "provider/services/sharing_client.h"
#include "provider/testing/operations_fixture.h"

namespace yomber {

/// The service sources of the document "d:5", and clients that connect to them.
class ServiceConnectionsTest : public OperationsTest {
 protected:
  ServiceConnectionsTest() { addDocument(5, "five.txt"); }

  static NSXPCInterfaceRef collaborationInterface() {
    return NSXPCInterface::interfaceWithProtocol<QSFileProviderPandrelCollaboration>();
  }
  static NSXPCConnectionRef connect(ListeningServiceSource& source,
                                    const NSXPCInterfaceRef& interface) {
    const auto connection =
        NSXPCConnection::initWithListenerEndpoint(source.makeListenerEndpointAndReturnError());
    connection->setRemoteObjectInterface(interface);
    connection->resume();
    return connection;
  }
  NSXPCConnectionRef connectToSharing() { return connect(*sharing, getSharingServiceInterface()); }
  NSXPCConnectionRef connectToCollaboration() {
    return connect(*collaboration, collaborationInterface());
  }
  /// Waits for one reply of the collaboration service; the failure of the call itself otherwise.
  NSErrorRef fetchesAVersion(const NSXPCConnectionRef& connection) {
    const auto failures = std::make_shared<Awaited<NSErrorRef>>();
    connection
        ->remoteObjectProxyWithErrorHandler<QSFileProviderPandrelCollaboration>(into(failures))
        ->fetchVersionAndCapabilitiesWithCompletionHandler(
            [failures](std::uint64_t, std::uint64_t, const NSErrorRef& error) {
              failures->add(error);
            });
    return only(failures);
  }
  /// The same of the sharing service.
  NSErrorRef isShared(const NSXPCConnectionRef& connection) {
    const auto failures = std::make_shared<Awaited<NSErrorRef>>();
    connection->remoteObjectProxyWithErrorHandler<QSSharingServiceV1>(into(failures))
        ->fetchSharingInfo([failures](bool, const NSFileProviderItemRef&, const NSErrorRef& error) {
          failures->add(error);
        });
    return only(failures);
  }

  const std::shared_ptr<NSOperationQueue> queue = std::make_shared<NSOperationQueue>();
  const std::shared_ptr<QSSharingClient> sharing =
      QSSharingClient::initWithFileProviderExtension(extension, "d:5", queue);
  const std::shared_ptr<QSFileProviderPandrelCollaborationServiceSource> collaboration =
      QSFileProviderPandrelCollaborationServiceSource::initWithFileProviderExtension(extension,
                                                                                     "d:5", queue);
};

}  // namespace yomber
