#include <memory>
#include <string>
#include <utility>

#include "platform/foundation/log.h"
#include "platform/ostrell/errors.h"
#include "platform/ostrell/file_providing_operation.h"
#include "platform/ostrell/item_additions.h"
#include "platform/ostrell/reading_options.h"
#include "platform/ostrell/url_additions.h"
#include "provider/extension/error_mapping.h"
#include "provider/extension/extension.h"
#include "provider/extension/log_sections.h"

namespace yomber {
namespace {

/// Reading options as the log shows them; written out only when the line is.
struct PrintedOptions {
  NSFileCoordinatorReadingOptions options;
  [[nodiscard]] std::string description() const {
    return QSFileCoordinatorReadingOptionsPrettyPrint(options);
  }
};

}  // namespace

void QSFileProviderExtension::startProvidingItemAtURL(const NSURLRef& url,
                                                      ErrorHandler completionHandler) {
  startProvidingItemAtURL(url, 0, std::move(completionHandler));
}

void QSFileProviderExtension::startProvidingItemAtURL(
    const NSURLRef& url, NSFileCoordinatorReadingOptions readingOptions,
    ErrorHandler completionHandler) {
  if (!qs_isInSyncedLocation(url)) {
    if (completionHandler) completionHandler(nullptr);
    return;
  }
  Log& log = qsc_default_log();
  const std::uint64_t section = createLogSection(LogSectionLevel::Debug);
  log_debug(log, "[DEBUG] ┣%llx start providing %@ (readingOptions: %@)", section, url->path(),
            PrintedOptions{readingOptions});

  const bool isForced = (readingOptions & QSFileCoordinatorReadingForcesProviding) != 0;
  if (qs_isPromiseURL(url)) {
    log_error(log,
              "[ERROR] Someone tries to coordinate at the side fault URL '%@', odd, but allow it",
              url->path());
  } else if (!isForced && url->checkResourceIsReachableAndReturnError()) {
    log_debug(log, "[DEBUG] url exists, granting the read");
    if (completionHandler) completionHandler(nullptr);
    return;  // This section is never closed.
  }
  _provideItemAtURL(url, readingOptions, section, std::move(completionHandler));
}

void QSFileProviderExtension::_provideItemAtURL(const NSURLRef& url,
                                                NSFileCoordinatorReadingOptions readingOptions,
                                                std::uint64_t section,
                                                ErrorHandler completionHandler) {
  const std::string& path = url->path();
  const auto operation = QSFileProvidingOperation::initWithURL(url, readingOptions);
  operation->setFileProvidingCompletion(
      [self = shared_from_this(), path, section,
       completionHandler = std::move(completionHandler)](const NSErrorRef& error) {
        self->_didProvideItemAtPath(path, section, error, completionHandler);
      });
  std::shared_ptr<QSFileProvidingOperation> replaced;
  {
    LockGuard guard(_lock);
    auto& entry = _downloadOperationByPath[path];
    if (entry != nullptr) {
      log_fault(qsc_default_log(),
                "[CRIT] Assertion failed: _downloadOperationByPath[path] == nil");
    }
    replaced = std::exchange(entry, operation);
  }
  _operationQueue->addOperation(operation);
}

void QSFileProviderExtension::_didProvideItemAtPath(const std::string& path, std::uint64_t section,
                                                    const NSErrorRef& error,
                                                    const ErrorHandler& completionHandler) {
  log_debug(qsc_default_log(), "[DEBUG] ┳%llx item providing completion; %@", section, error);
  std::shared_ptr<QSFileProvidingOperation> removed;
  {
    LockGuard guard(_lock);
    const auto found = _downloadOperationByPath.find(path);
    if (found == _downloadOperationByPath.end()) {
      log_fault(qsc_default_log(), "[CRIT] Assertion failed: self->_downloadOperationByPath[path]");
    } else {
      removed = std::move(found->second);
      _downloadOperationByPath.erase(found);
    }
  }
  if (completionHandler) completionHandler(qs_fileProviderError(error));
  closeLogSection(&section);
}

}  // namespace yomber
