#include <string>
#include <vector>

#include "platform/fileprovider/tags_data.h"
#include "platform/foundation/file_manager.h"
#include "platform/foundation/log.h"
#include "platform/ostrell/errors.h"
#include "platform/ostrell/file_manager_additions.h"
#include "platform/ostrell/item_additions.h"
#include "provider/extension/error_mapping.h"
#include "provider/extension/extension.h"
#include "provider/extension/log_sections.h"

namespace yomber {

void QSFileProviderExtension::setLastUsedDate(const std::optional<NSDate>& date,
                                              const NSFileProviderItemIdentifier& forItemIdentifier,
                                              ItemHandler completionHandler) {
  const LogSection section(LogSectionLevel::Debug);
  log_debug(qsc_default_log(), "[DEBUG] ┏%llx set last used date %@ for %@", section.id(), date,
            forItemIdentifier);
  const NSURLRef url = _URLForItemWithPersistentIdentifier(forItemIdentifier, ResolveAliases::No);
  qs_setLastOpenDate(NSFileManager::defaultManager(), date, url);
  NSErrorRef error;
  const QSQueryItemRef item = _propertiesForNewItemAtURL(url, &error);
  if (completionHandler) completionHandler(item, error);
}

void QSFileProviderExtension::setFavoriteRank(const std::optional<std::int64_t>& rank,
                                              const NSFileProviderItemIdentifier& forItemIdentifier,
                                              ItemHandler completionHandler) {
  const LogSection section(LogSectionLevel::Debug);
  log_debug(qsc_default_log(), "[DEBUG] ┏%llx set favorite rank %@ for %@", section.id(), rank,
            forItemIdentifier);
  const NSURLRef url = _URLForItemWithPersistentIdentifier(forItemIdentifier, ResolveAliases::No,
                                                           AttachPhysical::Yes);
  qs_setFavoriteRank(NSFileManager::defaultManager(), rank, url);
  NSErrorRef error;
  const QSQueryItemRef item = _propertiesForNewItemAtURL(url, &error);
  if (completionHandler) completionHandler(item, error);
}

void QSFileProviderExtension::setTagData(const NSDataRef& tagData,
                                         const NSFileProviderItemIdentifier& forItemIdentifier,
                                         ItemHandler completionHandler) {
  const LogSection section(LogSectionLevel::Debug);
  const std::size_t length = tagData != nullptr ? tagData->length() : 0;
  log_debug(qsc_default_log(), "[DEBUG] ┏%llx set tag data (%lu bytes) for %@", section.id(),
            length, forItemIdentifier);
  std::vector<std::string> names;
  for (const auto& tag : FPGetTagsFromTagsData(tagData)) {
    if (auto label = tag->valueForKey("label")) names.push_back(*std::move(label));
  }
  const NSURLRef url = _URLForItemWithPersistentIdentifier(forItemIdentifier, ResolveAliases::Yes,
                                                           AttachPhysical::Yes);
  NSErrorRef error;
  if (qs_setTagNames(url, names, &error)) {
    const QSQueryItemRef item = _propertiesForNewItemAtURL(url, &error);
    completionHandler(item, error);
    return;
  }
  log_error(qsc_default_log(), "[ERROR] can't set tags for %@; %@", url, error);
  if (completionHandler) completionHandler(nullptr, qs_fileProviderError(error));
}

}  // namespace yomber
