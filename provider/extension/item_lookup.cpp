#include "platform/fileprovider/constants.h"
#include "platform/fileprovider/errors.h"
#include "platform/foundation/log.h"
#include "platform/ostrell/constants.h"
#include "platform/ostrell/container.h"
#include "platform/ostrell/daemon_connection.h"
#include "platform/ostrell/errors.h"
#include "platform/ostrell/url_additions.h"
#include "provider/extension/error_mapping.h"
#include "provider/extension/extension.h"
#include "provider/extension/log_sections.h"

namespace yomber {
namespace {

template <typename Map>
typename Map::mapped_type valueOrNil(const Map& map, const typename Map::key_type& key) {
  const auto found = map.find(key);
  return found == map.end() ? nullptr : found->second;
}

/// The root's location, computed once and kept for the life of the process, also when it is nil.
const NSURLRef& rootLocation() {
  static const auto* const location = [] {
    const auto containers = QSContainer::allContainersByContainerID();
    const QSContainerRef container = valueOrNil(containers, QSUbiquitousDefaultContainerID);
    return new NSURLRef(container != nullptr ? container->documentsURL() : nullptr);
  }();
  return *location;
}

/// Asks the daemon where the item is; `url` when it has no answer.
NSURLRef locationFromDaemon(const NSFileProviderItemIdentifier& identifier, const NSURLRef& url) {
  const QSDaemonSyncProxyRef proxy = QSDaemonConnection::defaultConnection().newSyncProxy();
  proxy->getURLForItemIdentifier(identifier, [proxy](NSURLRef location, NSErrorRef error) {
    proxy->setObjResult(std::move(location), std::move(error));
  });
  if (const auto answer = std::dynamic_pointer_cast<const NSURL>(proxy->result())) {
    // The result is kept as any object; locations are changed in place by their marks.
    return std::const_pointer_cast<NSURL>(answer);
  }
  log_default(qsc_default_log(), "[WARNING] Failed getting url of %@ - %@", identifier,
              proxy->error());
  return url;
}

/// The documents location of the id that `identifier` prints; nil and perhaps an error without one.
NSURLRef documentLocation(const NSFileProviderItemIdentifier& identifier, NSErrorRef* error) {
  const auto fileObjectID = QSFileObjectID::fileObjectIDWithString(identifier);
  return fileObjectID != nullptr ? qs_documentURLFromFileObjectID(fileObjectID, error) : nullptr;
}

}  // namespace

NSURLRef QSFileProviderExtension::URLForItemWithPersistentIdentifier(
    const NSFileProviderItemIdentifier& identifier) {
  return _URLForItemWithPersistentIdentifier(identifier, ResolveAliases::Yes);
}

NSURLRef QSFileProviderExtension::_URLForItemWithPersistentIdentifier(
    const NSFileProviderItemIdentifier& identifier, ResolveAliases resolvingQSAliases) {
  return _URLForItemWithPersistentIdentifier(identifier, resolvingQSAliases, AttachPhysical::No);
}

NSURLRef QSFileProviderExtension::_URLForItemWithPersistentIdentifier(
    const NSFileProviderItemIdentifier& identifier, ResolveAliases resolvingQSAliases,
    AttachPhysical attachPhysical) {
  Log& log = qsc_default_log();
  const LogSection section(LogSectionLevel::Debug);
  log_debug(log, "[DEBUG] ┏%llx asked url for %@", section.id(), identifier);

  if (identifier == NSFileProviderRootContainerItemIdentifier) {
    const NSURLRef& root = rootLocation();
    log_debug(log, "[DEBUG] returning %@", root);
    return root;
  }

  NSErrorRef error;
  NSURLRef url = documentLocation(identifier, &error);
  if (resolvingQSAliases == ResolveAliases::Yes && qs_isExternalDocumentReference(url)) {
    log_debug(log, "[DEBUG] we have a bookmark, returning its target");
    url = qs_URLByResolvingExternalDocumentReferenceWithError(url, &error);
  }

  if (qs_isInOstrellPrivateStorages(url) || qs_wouldBeExcludedFromSync(url)) {
    log_default(log,
                "[WARNING] Detected url in private or excluded location %@ -- Fetching URL from "
                "daemon for %@",
                url->path(), identifier);
    url = locationFromDaemon(identifier, url);
  }

  if (url != nullptr) {
    log_debug(log, "[DEBUG] returning %@", url);
  } else {
    log_error(log, "[ERROR] returning nil, there was an error: %@", error);
  }

  if (!qs_isInSyncedLocation(url)) return nullptr;
  if (attachPhysical == AttachPhysical::Yes) qs_addPhysicalProperty(url);
  return url;
}

std::optional<NSFileProviderItemIdentifier>
QSFileProviderExtension::persistentIdentifierForItemAtURL(const NSURLRef& url) {
  if (!qs_isInSyncedLocation(url)) return std::nullopt;
  Log& log = qsc_default_log();
  const LogSection section(LogSectionLevel::Debug);
  log_debug(log, "[DEBUG] ┏%llx asked identifier for %@", section.id(), url->path());

  NSErrorRef error;
  const QSQueryItemRef item = _propertiesForItemAtURL(url, &error);
  std::optional<NSFileProviderItemIdentifier> identifier;
  if (error != nullptr) {
    log_debug(log, "[DEBUG] couldn't get item identifier at %@: %@", url, error);
  } else if (item != nullptr) {
    identifier = item->itemIdentifier();
  }
  log_debug(log, "[DEBUG] returning %@", identifier);
  return identifier;
}

NSFileProviderItemRef QSFileProviderExtension::itemForIdentifier(
    const NSFileProviderItemIdentifier& identifier, NSErrorRef* error) {
  const LogSection section(LogSectionLevel::Debug);
  log_debug(qsc_default_log(), "[DEBUG] ┏%llx asked properties for %@", section.id(), identifier);
  if (!_isLoggedInOrError(error)) return nullptr;

  if (const NSURLRef url = URLForItemWithPersistentIdentifier(identifier)) {
    QSQueryItemRef item = _propertiesForItemAtURL(url, error);
    log_debug(qsc_default_log(), "[DEBUG] returning %@", item);
    return item;
  }
  const NSErrorRef failure = fileProviderErrorForNonExistentItemWithIdentifier(identifier);
  logErrorOutParameter("-[QSFileProviderExtension itemForIdentifier:error:]", error, failure);
  storeError(error, failure);
  return nullptr;
}

QSQueryItemRef QSFileProviderExtension::_propertiesForNewItemAtURL(const NSURLRef& url,
                                                                   NSErrorRef* error) {
  return _propertiesForItemAtURL(url, ForceScan::Yes, error);
}

QSQueryItemRef QSFileProviderExtension::_propertiesForItemAtURL(const NSURLRef& url,
                                                                NSErrorRef* error) {
  return _propertiesForItemAtURL(url, ForceScan::No, error);
}

QSQueryItemRef QSFileProviderExtension::_propertiesForItemAtURL(const NSURLRef& url,
                                                                ForceScan forceScan,
                                                                NSErrorRef* error) {
  if (!qs_isInSyncedLocation(url)) {
    storeError(error,
               NSError::errorWithDomain(NSFileProviderErrorDomain, NSFileProviderErrorNoSuchItem));
    return nullptr;
  }
  Log& log = qsc_default_log();
  const LogSection section(LogSectionLevel::Debug);
  log_debug(log, "[DEBUG] ┏%llx asked properties for %@", section.id(), url->path());

  QSQueryItemRef item;
  const auto containerID = qs_containerIDIfIsDocumentsContainerURL(url);
  // Documents and Desktop are ordinary folders to the daemon.
  if (containerID && *containerID != QSUbiquitousDocumentsContainerID &&
      *containerID != QSUbiquitousDesktopContainerID) {
    const auto containers = QSContainer::allContainersByContainerID();
    item = QSQueryItem::containerItemForContainer(valueOrNil(containers, *containerID), forceScan);
  } else {
    item = QSQueryItem::askDaemonQueryItemForURL(url, forceScan, error);
  }
  log_debug(log, "[DEBUG] returning %@", item);
  if (error != nullptr && *error != nullptr) *error = qs_fileProviderError(*error);
  return item;
}

}  // namespace yomber
