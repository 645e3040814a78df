#include "provider/services/collaboration_service_source.h"

#include <utility>

#include "platform/foundation/log.h"
#include "platform/ostrell/collaboration_service.h"
#include "platform/ostrell/errors.h"
#include "provider/services/collaboration_proxy.h"

namespace yomber {

std::shared_ptr<QSFileProviderPandrelCollaborationServiceSource>
QSFileProviderPandrelCollaborationServiceSource::initWithFileProviderExtension(
    std::shared_ptr<QSFileProviderExtension> fileProviderExtension, std::string itemIdentifier,
    std::shared_ptr<NSOperationQueue> operationQueue) {
  return std::shared_ptr<QSFileProviderPandrelCollaborationServiceSource>(
      new QSFileProviderPandrelCollaborationServiceSource(
          std::move(fileProviderExtension), std::move(itemIdentifier), std::move(operationQueue)));
}

NSFileProviderServiceName QSFileProviderPandrelCollaborationServiceSource::serviceName() const {
  return QSCollaborationServiceName;
}

void QSFileProviderPandrelCollaborationServiceSource::exportObjectTo(NSXPCConnection& connection) {
  connection.setExportedInterface(
      NSXPCInterface::interfaceWithProtocol<QSFileProviderPandrelCollaboration>());
  connection.setExportedObject<QSFileProviderPandrelCollaboration>(
      QSFileProviderPandrelCollaborationProxy::initWithFileProviderExtension(
          _fileProviderExtension, _itemIdentifier, _operationQueue));
}

QSFileProviderPandrelCollaborationServiceSource::EndLog
QSFileProviderPandrelCollaborationServiceSource::endLog() const {
  return {
      .invalidated =
          [] {
            log_debug(qsc_default_log(),
                      "[DEBUG] collaboration service source connection invalidated");
          },
      .interrupted =
          [] {
            log_debug(qsc_default_log(),
                      "[DEBUG] collaboration service source connection interrupted");
          },
  };
}

}  // namespace yomber
