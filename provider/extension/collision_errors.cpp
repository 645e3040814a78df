#include "platform/fileprovider/errors.h"
#include "platform/fileprovider/file_operations.h"
#include "provider/extension/extension.h"

namespace yomber {

NSErrorRef QSFileProviderExtension::fileProviderErrorFromFSError(const NSErrorRef& error) {
  if (error == nullptr || !error->is(NSCocoaErrorDomain, NSFileWriteFileExistsError)) return error;
  const NSURLRef collidingURL = fp_collidingURL(error);
  if (collidingURL == nullptr) return error;
  const QSQueryItemRef item = _propertiesForItemAtURL(collidingURL, nullptr);
  return item != nullptr ? fileProviderErrorForCollisionWithItem(item) : error;
}

}  // namespace yomber
