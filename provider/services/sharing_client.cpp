#include "provider/services/sharing_client.h"

#include <utility>

#include "platform/foundation/log.h"
#include "platform/ostrell/errors.h"
#include "platform/ostrell/sharing_service.h"
#include "provider/services/sharing_proxy.h"

namespace yomber {

std::shared_ptr<QSSharingClient> QSSharingClient::initWithFileProviderExtension(
    std::shared_ptr<QSFileProviderExtension> fileProviderExtension, std::string itemIdentifier,
    std::shared_ptr<NSOperationQueue> operationQueue) {
  return std::shared_ptr<QSSharingClient>(new QSSharingClient(
      std::move(fileProviderExtension), std::move(itemIdentifier), std::move(operationQueue)));
}

NSFileProviderServiceName QSSharingClient::serviceName() const { return QSSharingServiceName; }

void QSSharingClient::exportObjectTo(NSXPCConnection& connection) {
  connection.setExportedInterface(getSharingServiceInterface());
  connection.setExportedObject<QSSharingServiceV1>(QSSharingProxy::initWithFileProviderExtension(
      _fileProviderExtension, _itemIdentifier, _operationQueue));
}

QSSharingClient::EndLog QSSharingClient::endLog() const {
  return {
      .invalidated =
          [] {
            log_debug(qsc_default_log(), "[DEBUG] sharing service source connection invalidated");
          },
      .interrupted =
          [] {
            log_debug(qsc_default_log(), "[DEBUG] sharing service source connection interrupted");
          },
  };
}

}  // namespace yomber
