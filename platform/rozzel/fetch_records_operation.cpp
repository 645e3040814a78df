#include "platform/rozzel/fetch_records_operation.h"

#include <algorithm>

#include "platform/foundation/fault_points.h"

namespace yomber {
namespace {

/// The first few records are read alone, so that somebody who waits sees something at once.
constexpr std::size_t kFirstPart = 8;
constexpr std::size_t kPart = 256;

FaultPoint beforePart("rozzel.fetch.part");

NSErrorRef notAuthenticated() {
  return rz_error(RZErrorNotAuthenticated,
                  "nobody is signed in to the record store; sign in with \"yomber account\"");
}

}  // namespace

void RZFetchRecordsOperation::prepare(RZEngineRef engine, RZDatabaseID database) {
  engine_ = std::move(engine);
  database_ = std::move(database);
  const std::weak_ptr<NSOperation> weak = weak_from_this();
  setCompletionBlock([weak] {
    if (const auto self = weak.lock()) static_cast<RZFetchRecordsOperation&>(*self).complete();
  });
}

void RZFetchRecordsOperation::main() {
  if (engine_ == nullptr || database_.accountName.empty()) storeFailure_ = notAuthenticated();
  fetchAll();
}

void RZFetchRecordsOperation::fetchAll() {
  std::size_t part = kFirstPart;
  for (std::size_t begin = 0; begin < recordIDs_.size() && !isCancelled();) {
    const std::size_t end = std::min(begin + part, recordIDs_.size());
    fetchPart(begin, end);
    begin = end;
    part = kPart;
  }
  noteFailure(storeFailure_);
}

void RZFetchRecordsOperation::fetchPart(std::size_t begin, std::size_t end) {
  const auto first = recordIDs_.begin();
  const std::vector<RZRecordID> wanted(first + static_cast<std::ptrdiff_t>(begin),
                                       first + static_cast<std::ptrdiff_t>(end));
  std::vector<RZFetchedRecord> records;
  if (storeFailure_ == nullptr && beforePart.hit()) {
    storeFailure_ = rz_error(RZErrorNetworkUnavailable, "the fetch was told to fail");
  }
  if (storeFailure_ == nullptr) {
    storeFailure_ = engine_->fetchRecords(database_, wanted, desiredKeys_, records);
  }
  if (storeFailure_ != nullptr) {
    records.clear();
    for (const RZRecordID& id : wanted) {
      records.push_back({.recordID = id, .record = nullptr, .error = storeFailure_});
    }
  }
  for (RZFetchedRecord& fetched : records) {
    if (isCancelled()) return;
    handOver(std::move(fetched));
  }
}

void RZFetchRecordsOperation::handOver(RZFetchedRecord fetched) {
  if (fetched.error != nullptr && !rz_isError(fetched.error, RZErrorUnknownItem)) {
    noteFailure(fetched.error);
  }
  if (!perRecord_) return;
  const RZRecordRef record = fetched.record != nullptr ? withAssetFiles(fetched.record) : nullptr;
  perRecord_(record, fetched.recordID, std::move(fetched.error));
}

void RZFetchRecordsOperation::noteFailure(const NSErrorRef& error) {
  if (failure_ == nullptr) failure_ = error;
}

RZRecordRef RZFetchRecordsOperation::withAssetFiles(const RZRecordRef& record) const {
  std::shared_ptr<RZRecord> result;
  for (const auto& [key, value] : record->values()) {
    const auto* const asset = std::get_if<RZAsset>(&value);
    std::string path;
    if (asset == nullptr || engine_->localFile(*asset, path) != nullptr) continue;
    if (result == nullptr) result = std::make_shared<RZRecord>(*record);
    result->setAssetFile(std::move(path), key);
  }
  return result != nullptr ? result : record;
}

void RZFetchRecordsOperation::complete() {
  const CompletionBlock completion = std::exchange(completion_, nullptr);
  perRecord_ = nullptr;
  if (!completion) return;
  completion(isCancelled() ? NSError::errorWithDomain(NSCocoaErrorDomain, NSUserCancelledError)
                           : failure_);
}

std::string RZFetchRecordsOperation::description() const {
  std::string text =
      NSOperation::description() + " of " + std::to_string(recordIDs_.size()) + " records";
  if (group_ != nullptr) text += " (" + group_->name() + ")";
  return text;
}

}  // namespace yomber
