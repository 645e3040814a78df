#include "platform/fileprovider/constants.h"
#include "platform/fileprovider/errors.h"
#include "platform/foundation/log.h"
#include "platform/ostrell/errors.h"
#include "platform/ostrell/file_object_id.h"
#include "provider/enumeration/directories_enumerator.h"
#include "provider/enumeration/file_enumerator.h"
#include "provider/enumeration/working_set_enumerator.h"
#include "provider/extension/extension.h"
#include "provider/extension/log_sections.h"

namespace yomber {

NSFileProviderEnumeratorRef QSFileProviderExtension::enumeratorForContainerItemIdentifier(
    const NSFileProviderItemIdentifier& identifier, NSErrorRef* error) {
  const LogSection section(LogSectionLevel::Debug);
  log_debug(qsc_default_log(), "[DEBUG] ┏%llx enumerator for %@", section.id(), identifier);
  if (!_isLoggedInOrError(error)) return nullptr;

  if (identifier == NSFileProviderWorkingSetContainerItemIdentifier) {
    return std::make_shared<QSWorkingSetEnumerator>();
  }
  if (identifier == NSFileProviderAllDirectoriesContainerItemIdentifier) {
    return std::make_shared<QSDirectoriesEnumerator>();
  }
  QSFileObjectIDRef fileObjectID;  // Nil for the root.
  if (identifier != NSFileProviderRootContainerItemIdentifier) {
    fileObjectID = QSFileObjectID::fileObjectIDWithString(identifier);
  }
  if (const NSURLRef url = URLForItemWithPersistentIdentifier(identifier)) {
    return QSFileEnumerator::initWithFileObjectID(fileObjectID, url, identifier, Recursive::No);
  }

  const NSErrorRef failure = fileProviderErrorForNonExistentItemWithIdentifier(identifier);
  if (failure != nullptr) {
    logErrorOutParameter("-[QSFileProviderExtension enumeratorForContainerItemIdentifier:error:]",
                         error, failure);
  }
  storeError(error, failure);
  return nullptr;
}

}  // namespace yomber
