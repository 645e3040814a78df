#include "platform/rozzel/record.h"

#include <utility>

namespace yomber {

RZRecord::RZRecord(std::string recordType, RZRecordID recordID)
    : recordType_(std::move(recordType)), recordID_(std::move(recordID)) {}

RZRecord::RZRecord(std::string recordType, RZRecordID recordID, RZValues values, Stamp stamp)
    : recordType_(std::move(recordType)),
      recordID_(std::move(recordID)),
      values_(std::move(values)),
      stamp_(std::move(stamp)) {}

const RZValue* RZRecord::objectForKey(std::string_view key) const {
  const auto found = values_.find(key);
  return found != values_.end() ? &found->second : nullptr;
}

void RZRecord::setObject(RZValue object, const std::string& key) {
  values_.insert_or_assign(key, std::move(object));
  assetFiles_.erase(key);
  changedKeys_.insert(key);
}

void RZRecord::removeObjectForKey(const std::string& key) {
  values_.erase(key);
  assetFiles_.erase(key);
  changedKeys_.insert(key);
}

std::vector<RZAsset> RZRecord::assets() const {
  std::vector<RZAsset> result;
  for (const auto& [key, value] : values_) {
    if (const auto* const asset = std::get_if<RZAsset>(&value)) result.push_back(*asset);
  }
  return result;
}

std::optional<std::string> RZRecord::assetFile(std::string_view key) const {
  const auto found = assetFiles_.find(key);
  return found != assetFiles_.end() ? std::optional(found->second) : std::nullopt;
}

void RZRecord::setAssetFile(std::string path, const std::string& key) {
  assetFiles_.insert_or_assign(key, std::move(path));
}

std::string RZRecord::description() const {
  return recordType_ + " " + recordID_.description() + ", tag " +
         (stamp_.changeTag.empty() ? "(none)" : stamp_.changeTag);
}

}  // namespace yomber
