// Which services an item has.

#include <optional>
#include <string>
#include <utility>

#include "platform/foundation/log.h"
#include "platform/ostrell/daemon_connection.h"
#include "platform/ostrell/errors.h"
#include "platform/ostrell/file_object_id.h"
#include "platform/ostrell/url_resource_values.h"
#include "provider/extension/extension.h"
#include "provider/services/collaboration_service_source.h"
#include "provider/services/sharing_client.h"

namespace yomber {
namespace {

std::optional<std::string> pathOf(const NSURLRef& url) {
  return url == nullptr ? std::nullopt : std::optional(url->path());
}

/// Bookmark files have no services.
bool isAliasFile(const NSURLRef& url) {
  std::optional<bool> isAlias;
  NSErrorRef error;
  if (!getPromisedItemResourceValue(url, isAlias, NSURLIsAliasFileKey, &error)) {
    log_error(qsc_default_log(), "[ERROR] Failed to get alias file key at %@ - %@", pathOf(url),
              error);
  }
  return isAlias.value_or(false);
}

bool isShareable(const NSFileProviderItemIdentifier& identifier) {
  const auto objectID = QSFileObjectID::fileObjectIDWithString(identifier);
  const std::uint64_t rawID = objectID == nullptr ? 0 : objectID->rawID();
  const auto proxy = QSDaemonConnection::defaultConnection().newSyncProxy();
  proxy->checkIfItemIsShareableWithInode(rawID, [proxy](bool shareable, NSErrorRef error) {
    proxy->setBoolResult(shareable, std::move(error));
  });
  if (proxy->boolResult()) return true;
  log_default(qsc_default_log(), "[WARNING] %@ is not shareable - %@", identifier, proxy->error());
  return false;
}

}  // namespace

std::vector<NSFileProviderServiceSourceRef>
QSFileProviderExtension::supportedServiceSourcesForItemIdentifier(
    const NSFileProviderItemIdentifier& identifier, NSErrorRef* /*error*/) {
  std::vector<NSFileProviderServiceSourceRef> sources;
  const char first = identifier.empty() ? '\0' : identifier.front();
  if (first == 'd') {
    const NSURLRef url = URLForItemWithPersistentIdentifier(identifier);
    if (isAliasFile(url)) {
      log_debug(qsc_default_log(),
                "[DEBUG] Not allowing sharing of %@ because it's a fendle bookmark", pathOf(url));
      return sources;
    }
    // In this order: clients take the first that they know.
    sources.push_back(
        QSFileProviderPandrelCollaborationServiceSource::initWithFileProviderExtension(
            shared_from_this(), identifier, _operationQueue));
    sources.push_back(QSSharingClient::initWithFileProviderExtension(shared_from_this(), identifier,
                                                                     _operationQueue));
  } else if (first == 'i' && isShareable(identifier)) {
    sources.push_back(QSSharingClient::initWithFileProviderExtension(shared_from_this(), identifier,
                                                                     _operationQueue));
  }
  return sources;
}

}  // namespace yomber
