#include "yomber/drive_collaboration.h"

#include "platform/fileprovider/services.h"

namespace yomber {

std::unique_ptr<CollaborationClient> openCollaboration(
    DriveClient& client, const NSFileProviderItemIdentifier& identifier, NSErrorRef* error) {
  const NSFileProviderServices services(client.paths());
  const auto service =
      services.serviceForItemIdentifier(identifier, QSCollaborationServiceName, error);
  const auto connection = service ? service->fileProviderConnection(error) : nullptr;
  if (!connection) return nullptr;
  connection->setRemoteObjectInterface(
      NSXPCInterface::interfaceWithProtocol<QSFileProviderPandrelCollaboration>());
  return std::make_unique<CollaborationClient>(connection);
}

}  // namespace yomber
