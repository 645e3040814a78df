#include "provider/extension/extension.h"

#include "platform/fileprovider/constants.h"
#include "platform/fileprovider/manager.h"
#include "platform/foundation/log.h"
#include "platform/foundation/notification_center.h"
#include "platform/ostrell/account.h"
#include "platform/ostrell/constants.h"
#include "platform/ostrell/errors.h"
#include "provider/extension/error_mapping.h"
#include "provider/extension/log_sections.h"

namespace yomber {

QSFileProviderExtension::QSFileProviderExtension() = default;

std::shared_ptr<QSFileProviderExtension> QSFileProviderExtension::init() {
  std::shared_ptr<QSFileProviderExtension> self(new QSFileProviderExtension);
  self->_operationQueue = std::make_shared<NSOperationQueue>();
  self->_queue = SerialQueue::create("fileprovider-plinthe");
  QSAccount::startAccountTokenChangeObserverIfNeeded();
  NSNotificationCenter::defaultCenter().addObserver(
      self, QSAccountTokenDidChangeNotification,
      [weakSelf = std::weak_ptr<QSFileProviderExtension>(self)] {
        if (const auto strongSelf = weakSelf.lock()) strongSelf->_accountDidChange();
      });
  return self;
}

QSFileProviderExtension::~QSFileProviderExtension() {
  NSNotificationCenter::defaultCenter().removeObserver(this, QSAccountTokenDidChangeNotification);
}

void QSFileProviderExtension::providePlaceholderAtURL(const NSURLRef& /*url*/,
                                                      ErrorHandler completionHandler) {
  if (completionHandler) completionHandler(nullptr);
}

bool QSFileProviderExtension::_isLoggedInOrError(NSErrorRef* error) {
  NSErrorRef accountError;
  const QSAccountRef account = QSAccount::currentCachedLoggedInAccountWithError(&accountError);
  NSErrorRef failure;
  if (accountError != nullptr) {
    failure = qs_fileProviderError(accountError);
  } else if (account != nullptr && account->perAppAccountIdentifier()) {
    return true;
  } else {
    failure =
        NSError::errorWithDomain(NSFileProviderErrorDomain, NSFileProviderErrorNotAuthenticated,
                                 {{NSUnderlyingErrorKey, qsc_errorLoggedOut()}});
  }
  logErrorOutParameter("-[QSFileProviderExtension _isLoggedInOrError:]", error, failure);
  storeError(error, failure);
  return false;
}

void QSFileProviderExtension::_accountDidChange() {
  log_debug(qsc_default_log(),
            "[DEBUG] received account did update notification, signal changes to fileproviderd");
  NSFileProviderManager::defaultManager().signalEnumeratorForContainerItemIdentifier(
      NSFileProviderRootContainerItemIdentifier, [](const NSErrorRef& error) {
        if (error == nullptr) return;
        log_error(qsc_default_log(), "[ERROR] failed to signal enumerator for root container: %@",
                  error);
      });
}

}  // namespace yomber
