#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <semaphore>
#include <string>
#include <utility>
#include <vector>

#include "platform/fileprovider/errors.h"
#include "platform/foundation/log.h"
#include "platform/glimmet/thumbnail_store_retrieval_operation.h"
#include "platform/ostrell/constants.h"
#include "platform/ostrell/daemon_connection.h"
#include "platform/ostrell/downloads.h"
#include "platform/ostrell/errors.h"
#include "platform/ostrell/record_store.h"
#include "platform/ostrell/url_additions.h"
#include "platform/ostrell/user_defaults.h"
#include "platform/rozzel/container.h"
#include "platform/rozzel/fetch_records_operation.h"
#include "provider/extension/error_mapping.h"
#include "provider/extension/extension.h"
#include "provider/extension/log_sections.h"

namespace yomber {
namespace {

/// What no thumbnail of that many pixels needs; a longer file is none.
constexpr std::size_t kMaximumImageBytes = std::size_t{8} << 20U;

/// Item identifiers by record.
using RecordsOfZone = std::map<RZRecordID, NSFileProviderItemIdentifier>;

std::map<RZRecordZoneID, RecordsOfZone> recordsByZone(const QSContentRecordIDs& recordIDs) {
  std::map<RZRecordZoneID, RecordsOfZone> result;
  for (const auto& [object, recordID] : recordIDs.recordIDs()) {
    result[recordID.zoneID()].insert_or_assign(recordID, object->asString());
  }
  return result;
}

std::vector<RZRecordID> idsOf(const RecordsOfZone& records) {
  std::vector<RZRecordID> ids;
  ids.reserve(records.size());
  for (const auto& [recordID, identifier] : records) ids.push_back(recordID);
  return ids;
}

/// The records of the documents, or nil and why they cannot be told.
QSContentRecordIDsRef contentRecordIDs(const std::vector<QSFileObjectIDRef>& fileObjectIDs,
                                       NSErrorRef& error) {
  const auto proxy = QSDaemonConnection::defaultConnection().newSyncProxy();
  proxy->resolveFileObjectIDsToContentRecordIDs(
      fileObjectIDs, [&proxy](const QSContentRecordIDsRef& found, const NSErrorRef& failure) {
        proxy->setObjResult(found, failure);
      });
  error = proxy->error();
  return std::dynamic_pointer_cast<const QSContentRecordIDs>(proxy->result());
}

}  // namespace

/// What the callbacks of one request need; the same for all of them.
struct QSFileProviderExtension::ThumbnailRequest {
  std::uint64_t fetchSection = 0;
  std::map<RZRecordZoneID, RecordsOfZone> recordsByZone;
  TypedThumbnailHandler handler;

  [[nodiscard]] std::optional<NSFileProviderItemIdentifier> identifierFor(
      const RZRecordID& recordID) const {
    const auto zone = recordsByZone.find(recordID.zoneID());
    if (zone == recordsByZone.end()) return std::nullopt;
    const auto found = zone->second.find(recordID);
    return found == zone->second.end() ? std::nullopt : std::optional(found->second);
  }
};

NSProgressRef QSFileProviderExtension::fetchThumbnailsForItemIdentifiers(
    const std::vector<NSFileProviderItemIdentifier>& identifiers, CGSize requestedSize,
    ThumbnailHandler perThumbnailCompletionHandler, ErrorHandler completionHandler) {
  ThumbnailHandler forwarding = [handler = std::move(perThumbnailCompletionHandler)](
                                    const NSFileProviderItemIdentifier& identifier,
                                    NSDataRef imageData, NSErrorRef error) {
    if (handler) handler(identifier, std::move(imageData), std::move(error));
  };
  QSFileProviderExtension& self = *this;
  return self.fetchThumbnailsForItemIdentifiers(identifiers, requestedSize, std::move(forwarding),
                                                std::move(completionHandler));
}

NSProgressRef QSFileProviderExtension::fetchThumbnailsForItemIdentifiers(
    const std::vector<NSFileProviderItemIdentifier>& identifiers, CGSize requestedSize,
    TypedThumbnailHandler perThumbnailCompletionHandlerWithType, ErrorHandler completionHandler) {
  Log& log = qsc_default_log();
  NSProgressRef progress = NSProgress::progressWithTotalUnitCount(0);
  const LogSection section(LogSectionLevel::Debug);
  log_debug(log, "[DEBUG] ┏%llx starting fetch thumbnail for %@", section.id(), identifiers);

  const auto fileObjectIDs =
      _answerOtherThumbnails(identifiers, requestedSize, perThumbnailCompletionHandlerWithType);
  if (fileObjectIDs.empty()) {
    log_debug(log, "[DEBUG] no thumbnail left to fetch");
    if (completionHandler) completionHandler(nullptr);
    return progress;
  }
  NSErrorRef error;
  const QSContentRecordIDsRef recordIDs = contentRecordIDs(fileObjectIDs, error);
  if (recordIDs == nullptr) {
    log_error(log, "[ERROR] can't get the record ids for %@: %@", fileObjectIDs, error);
    if (completionHandler) completionHandler(qs_fileProviderError(error));
    return progress;
  }
  const auto request = std::make_shared<ThumbnailRequest>();
  request->fetchSection = createLogSection(LogSectionLevel::Debug);
  log_debug(log, "[DEBUG] ┣%llx fetching the thumbnails for: %@", request->fetchSection, recordIDs);
  request->recordsByZone = recordsByZone(*recordIDs);
  request->handler = std::move(perThumbnailCompletionHandlerWithType);

  const auto operations = std::make_shared<ThumbnailOperations::element_type>();
  const auto zoneIDs = std::make_shared<ThumbnailZones::element_type>();
  const RZContainerRef container =
      RZContainer::containerWithIdentifier(QSUbiquitousRozzelContainerIdentifier);
  container->setSourceApplicationBundleIdentifier(QSDaemonBundleID);
  _addThumbnailFetches(request, operations, zoneIDs);
  auto cancelAll = [all = *operations] {  // the chain takes them out of the array
    for (const auto& operation : all) operation->cancel();
  };
  launchNewFetchThumbnailOperationFrom(operations, zoneIDs, container, nullptr, completionHandler);
  progress->setCancellable(true);
  progress->setCancellationHandler(std::move(cancelAll));
  return progress;
}

std::vector<QSFileObjectIDRef> QSFileProviderExtension::_answerOtherThumbnails(
    const std::vector<NSFileProviderItemIdentifier>& identifiers, CGSize requestedSize,
    const TypedThumbnailHandler& handler) {
  std::optional<std::map<std::string, QSContainerRef>> knownContainers;
  std::vector<QSFileObjectIDRef> fileObjectIDs;
  fileObjectIDs.reserve(identifiers.size());
  for (const auto& identifier : identifiers) {
    const NSURLRef url = URLForItemWithPersistentIdentifier(identifier);
    const auto containerID =
        url != nullptr ? qs_containerIDIfIsDocumentsContainerURL(url) : std::nullopt;
    if (containerID) {
      const CGSize size = _properSizeForContainerThumbnail(requestedSize);
      if (!knownContainers) knownContainers = QSContainer::allContainersByContainerID();
      _fetchThumbnailForContainerID(*containerID, identifier, size, *knownContainers, handler);
      continue;
    }
    const auto fileObjectID = QSFileObjectID::fileObjectIDWithString(identifier);
    if (fileObjectID == nullptr) {
      const auto error = fileProviderErrorForNonExistentItemWithIdentifier(identifier);
      if (handler) handler(identifier, nullptr, std::nullopt, error);
    } else if (fileObjectID->isFolderOrAliasID()) {
      if (handler) handler(identifier, nullptr, std::nullopt, nullptr);
    } else {
      fileObjectIDs.push_back(fileObjectID);
    }
  }
  return fileObjectIDs;
}

void QSFileProviderExtension::_addThumbnailFetches(const std::shared_ptr<ThumbnailRequest>& request,
                                                   const ThumbnailOperations& operations,
                                                   const ThumbnailZones& zoneIDs) {
  const RZOperationGroupRef group = qs_downloadThumbnailsUserInitiated();
  for (const auto& [zoneID, records] : request->recordsByZone) {
    std::vector<RZRecordID> recordIDs = idsOf(records);
    batchRecordIDsToFetchThumbnails(
        recordIDs, [&, &zone = zoneID, &all = records](const std::vector<RZRecordID>& /*batch*/) {
          const auto operation = std::make_shared<RZFetchRecordsOperation>();
          operations->push_back(operation);
          zoneIDs->push_back(zone);
          operation->setRecordIDs(idsOf(all));  // each batch asks for the whole zone
          operation->setDesiredKeys(
              std::vector<std::string>{kQSRecordKeyThumbnail1024x1024, kQSRecordKeySize});
          operation->setQualityOfService(NSQualityOfService::Utility);
          operation->configuration().setDiscretionaryNetworkBehavior(0);
          operation->configuration().setAutomaticallyRetryNetworkFailures(false);
          operation->configuration().setSourceApplicationBundleIdentifier(QSDaemonBundleID);
          operation->setPerRecordCompletionBlock(
              [self = shared_from_this(), request](
                  const RZRecordRef& record, const RZRecordID& recordID, const NSErrorRef& error) {
                self->_didFetchThumbnailRecord(*request, record, recordID, error);
              });
          operation->setGroup(group);
        });
  }
}

void QSFileProviderExtension::_didFetchThumbnailRecord(const ThumbnailRequest& request,
                                                       const RZRecordRef& record,
                                                       const RZRecordID& recordID,
                                                       const NSErrorRef& error) {
  Log& log = qsc_default_log();
  NSDataRef data;
  std::uint64_t size = 0;
  if (record != nullptr) {
    const auto file = record->assetFile(kQSRecordKeyThumbnail1024x1024);
    if (file) data = NSData::dataWithContentsOfFile(*file, kMaximumImageBytes);
    const auto* const number = record->valueForKey<std::int64_t>(kQSRecordKeySize);
    if (number != nullptr && *number > 0) size = static_cast<std::uint64_t>(*number);
  }
  const auto identifier = request.identifierFor(recordID);
  log_debug(log, "[DEBUG] ┳%llx received a thumbnail callback for %@", request.fetchSection,
            identifier);
  if (data != nullptr) {
    log_debug(log, "[DEBUG] received a thumbnail of %lu bytes for %@", data->length(), identifier);
  } else if (error != nullptr) {
    log_error(log, "[ERROR] error when fetching thumbnail for %@: %@", identifier, error);
  }
  if (request.handler) {
    request.handler(identifier.value_or(NSFileProviderItemIdentifier()), data, std::nullopt,
                    qs_fileProviderError(error));
  }
  if (data == nullptr && error == nullptr) {
    if (size != 0) {
      log_debug(log, "[DEBUG] no thumbnail found for a non-empty file");
      const auto threshold =
          QSRemoteUserDefaults::sharedDefaults().minFileSizeForThumbnailTransfer();
      if (size > threshold) _downloadForThumbnail(identifier);
    } else {
      log_debug(log, "[DEBUG] empty record for %@", identifier);
    }
  }
  closeLogSection(&request.fetchSection);
}

void QSFileProviderExtension::_downloadForThumbnail(
    const std::optional<NSFileProviderItemIdentifier>& identifier) {
  if (!identifier) return;
  const NSFileProviderItemRef item = itemForIdentifier(*identifier);
  if (item == nullptr) return;
  const std::string& type = item->fields().contentType;
  if (!GMThumbnailStoreRetrievalOperation::canMostRecentClientsGenerateThumbnailsForUTI(type)) {
    return;
  }
  const NSURLRef url = URLForItemWithPersistentIdentifier(*identifier);
  log_debug(qsc_default_log(),
            "[DEBUG] downloading file at %@ because glimmet can generate its thumbnail", url);
  if (url == nullptr) return;
  const auto begun = std::make_shared<std::binary_semaphore>(0);
  QSStartDownloadForItemsWithOptions(
      {url}, QSStartDownloadNotUserInitiated, [url, begun](const NSErrorRef& error) {
        if (error != nullptr) {
          log_error(qsc_default_log(), "[ERROR] can't start downloading %@: %@", url, error);
        }
        begun->release();
      });
  begun->acquire();
}

}  // namespace yomber
