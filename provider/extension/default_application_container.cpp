#include <array>
#include <set>
#include <utility>

#include "platform/fileprovider/constants.h"
#include "platform/foundation/log.h"
#include "platform/launchservices/bundle_proxy.h"
#include "platform/ostrell/constants.h"
#include "platform/ostrell/daemon_connection.h"
#include "platform/ostrell/entitlements.h"
#include "platform/ostrell/errors.h"
#include "provider/extension/error_mapping.h"
#include "provider/extension/extension.h"
#include "provider/extension/log_sections.h"

namespace yomber {
namespace {

constexpr const char* kFilesBrowser = "com.kelvo.Bindra";

/// What the application declares of what decides about its containers.
std::map<std::string, NSPropertyValue> entitlementsOf(const LSBundleProxy& proxy) {
  const std::set<std::string> keys{QSApplicationIdentifierEntitlement, QSYomberServicesEntitlement,
                                   QSYomberContainerIdentifiersEntitlement,
                                   QSUbiquityContainerIdentifiersEntitlement};
  const LSPropertyValues values = proxy.entitlementValuesForKeys(keys);
  std::map<std::string, NSPropertyValue> entitlements;
  for (const auto& key : keys) {
    if (auto value = values.objectForKey(key)) entitlements.emplace(key, *std::move(value));
  }
  return entitlements;
}

}  // namespace

void QSFileProviderExtension::_defaultApplicationContainerForBundleIdentifier(
    const std::optional<std::string>& bundleIdentifier, ItemHandler completionHandler) {
  Log& log = qsc_default_log();
  const LogSection section(LogSectionLevel::Debug);
  log_debug(log, "[DEBUG] ┏%llx lookup for default location of %@", section.id(), bundleIdentifier);

  if (!bundleIdentifier || *bundleIdentifier == kFilesBrowser) {
    log_debug(log, "[DEBUG] creating default Documents folder");
    createDirectoryWithName(QSUbiquitousDocumentsFolderName,
                            NSFileProviderRootContainerItemIdentifier,
                            std::move(completionHandler));
    return;
  }

  const LSBundleProxyRef proxy = LSBundleProxy::bundleProxyForIdentifier(*bundleIdentifier);
  if (proxy == nullptr) {
    log_error(log, "[ERROR] can't find bundle with id '%@'", bundleIdentifier);
    const NSErrorRef error = qsc_errorInvalidParameter("bundleIdentifier", bundleIdentifier);
    if (completionHandler) completionHandler(nullptr, qs_fileProviderError(error));
    return;
  }

  const auto containerIDs = QSEntitledContainerIdentifiers(entitlementsOf(*proxy));
  if (containerIDs.empty()) {
    log_debug(log, "[DEBUG] bundle '%@' is not entitled to used Yomber Drive", bundleIdentifier);
    const NSErrorRef error =
        NSError::errorWithDomain(QSOstrellErrorDomain, QSOstrellErrorNotEntitled);
    if (completionHandler) completionHandler(nullptr, qs_fileProviderError(error));
    return;
  }
  _answerContainerWithIdentifier(containerIDs.front(), std::move(completionHandler));
}

void QSFileProviderExtension::_answerContainerWithIdentifier(const std::string& containerID,
                                                             ItemHandler completionHandler) {
  const auto fail = [completionHandler](const NSErrorRef& error) {
    if (completionHandler) completionHandler(nullptr, qs_fileProviderError(error));
  };
  const auto proxy =
      QSDaemonConnection::defaultConnection().remoteObjectProxyWithErrorHandler(fail);
  proxy->getContainerURLForID(
      containerID, RecreateDocuments::Yes,
      [self = shared_from_this(), fail, completionHandler = std::move(completionHandler)](
          const NSURLRef& url, const std::string& /*displayName*/, std::uint64_t /*generation*/,
          const NSErrorRef& error) {
        if (error != nullptr) {
          fail(error);
          return;
        }
        NSErrorRef lookupError;
        const QSQueryItemRef item = self->_propertiesForItemAtURL(url, &lookupError);
        if (completionHandler) completionHandler(item, lookupError);
      });
}

}  // namespace yomber
