#include <cstdint>
#include <memory>
#include <utility>
#include <vector>

#include "platform/foundation/log.h"
#include "platform/ostrell/errors.h"
#include "platform/ostrell/user_defaults.h"
#include "platform/rozzel/container.h"
#include "platform/rozzel/fetch_records_operation.h"
#include "provider/extension/error_mapping.h"
#include "provider/extension/extension.h"

namespace yomber {

void QSFileProviderExtension::batchRecordIDsToFetchThumbnails(
    std::vector<RZRecordID>& recordIDs,
    const std::function<void(const std::vector<RZRecordID>& batch)>& perBatchExecutionBlock) {
  const std::uint32_t batchSize =
      QSCUserDefaults::defaultsForMangledID(std::nullopt).maxRecordCountInFetchRecordsOperation();
  std::size_t begin = 0;
  while (begin < recordIDs.size()) {
    const auto first = recordIDs.begin() + static_cast<std::ptrdiff_t>(begin);
    if (recordIDs.size() - begin < batchSize) {
      perBatchExecutionBlock({first, recordIDs.end()});
      break;
    }
    log_debug(qsc_default_log(),
              "[DEBUG] fetching thumbnails for more than %u item identifiers, batching request",
              batchSize);
    perBatchExecutionBlock({first, first + batchSize});
    begin += batchSize;
  }
  recordIDs.clear();
}

void QSFileProviderExtension::launchNewFetchThumbnailOperationFrom(
    const ThumbnailOperations& operations, const ThumbnailZones& withZoneIDs,
    const std::shared_ptr<RZContainer>& inContainer, const NSErrorRef& previousError,
    const ErrorHandler& completionHandler) {
  if (operations->empty() || withZoneIDs->empty()) {
    if (completionHandler) completionHandler(qs_fileProviderError(previousError));
    return;
  }
  const auto operation = operations->front();
  const RZRecordZoneID zoneID = withZoneIDs->front();
  operations->erase(operations->begin());
  withZoneIDs->erase(withZoneIDs->begin());
  operation->setFetchRecordsCompletionBlock([self = shared_from_this(), operations, withZoneIDs,
                                             inContainer, zoneID, lastError = previousError,
                                             completionHandler](NSErrorRef error) mutable {
    Log& log = qsc_default_log();
    log_debug(log, "[DEBUG] completed fetching thumbnail batch for %@", zoneID);
    if (error != nullptr) {
      log_error(log, "[ERROR] error while fetching thumbnail batch for %@: %@", zoneID, error);
      lastError = std::move(error);
    }
    if (!operations->empty() && !withZoneIDs->empty()) {
      log_debug(log, "[DEBUG] fetching next thumbnail batch");
      self->launchNewFetchThumbnailOperationFrom(operations, withZoneIDs, inContainer, lastError,
                                                 completionHandler);
      return;
    }
    log_debug(log, "[DEBUG] finished fetching all thumbnail batches");
    if (completionHandler) completionHandler(qs_fileProviderError(lastError));
  });
  log_debug(qsc_default_log(), "[DEBUG] scheduling operation %@ for zone: %@", operation, zoneID);
  const bool isOwn = zoneID.ownerName() == RZCurrentUserDefaultName;
  const auto& database =
      isOwn ? inContainer->privateCloudDatabase() : inContainer->sharedCloudDatabase();
  database->addOperation(operation);
}

}  // namespace yomber
