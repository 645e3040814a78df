#include "platform/rozzel/errors.h"

namespace yomber {

namespace {

class FailedRecords final : public NSObject {
 public:
  explicit FailedRecords(RZFailedRecords failures) : failures_(std::move(failures)) {}
  [[nodiscard]] const RZFailedRecords& failures() const { return failures_; }
  [[nodiscard]] std::string description() const override {
    return std::to_string(failures_.size()) + " records";
  }

 private:
  RZFailedRecords failures_;
};

template <typename T>
std::shared_ptr<const T> objectIn(const NSErrorRef& error, const char* key) {
  if (!error) return nullptr;
  const auto found = error->userInfo().find(key);
  if (found == error->userInfo().end()) return nullptr;
  const auto* const object = std::get_if<NSObjectRef>(&found->second);
  return object != nullptr ? std::dynamic_pointer_cast<const T>(*object) : nullptr;
}

}  // namespace

NSErrorRef rz_error(RZErrorCode code, std::string description, NSErrorUserInfo userInfo) {
  userInfo.insert_or_assign(NSLocalizedDescriptionKey, std::move(description));
  return NSError::errorWithDomain(RZErrorDomain, code, std::move(userInfo));
}

bool rz_isError(const NSErrorRef& error, RZErrorCode code) {
  return error != nullptr && error->is(RZErrorDomain, code);
}

bool rz_isTransient(const NSErrorRef& error) {
  return rz_isError(error, RZErrorNetworkUnavailable) || rz_isError(error, RZErrorStoreBusy) ||
         rz_isError(error, RZErrorStoreFull);
}

RZRecordRef rz_serverRecord(const NSErrorRef& error) {
  return objectIn<RZRecord>(error, RZErrorServerRecordKey);
}

RZFailedRecords rz_failedRecords(const NSErrorRef& error) {
  const auto found = objectIn<FailedRecords>(error, RZErrorFailedRecordsKey);
  return found ? found->failures() : RZFailedRecords{};
}

NSErrorRef rz_batchError(RZFailedRecords failures) {
  if (failures.empty()) return nullptr;
  const NSErrorRef first = failures.front().second;
  NSErrorUserInfo userInfo = first->userInfo();
  userInfo.insert_or_assign(RZErrorFailedRecordsKey,
                            NSObjectRef(std::make_shared<FailedRecords>(std::move(failures))));
  return NSError::errorWithDomain(first->domain(), first->code(), std::move(userInfo));
}

}  // namespace yomber
