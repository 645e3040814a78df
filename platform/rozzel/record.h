#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "platform/foundation/date.h"
#include "platform/foundation/object.h"
#include "platform/rozzel/asset.h"
#include "platform/rozzel/identifiers.h"

namespace yomber {

/// A value of plain bytes, told apart from a text.
struct RZBytes {
  std::string bytes;
  friend auto operator<=>(const RZBytes&, const RZBytes&) = default;
};

/// A pointer to another record. The store does not follow it: nothing is deleted along with it, and
/// what it points to need not exist.
struct RZReference {
  RZRecordID recordID;
  friend auto operator<=>(const RZReference&, const RZReference&) = default;
};

/// What a key of a record may hold. Texts are bytes to the store: they need not be UTF-8.
using RZValue = std::variant<std::string, RZBytes, std::int64_t, double, NSDate,
                             std::vector<std::string>, RZReference, RZAsset>;
using RZValues = std::map<std::string, RZValue, std::less<>>;

class RZRecord;
/// A record as the store has it, shared and never changed.
using RZRecordRef = std::shared_ptr<const RZRecord>;

/// A record: an id, a type, and values under keys. Copy one to change it; it remembers which keys
/// were set or removed since it came from the store, so that a save writes these alone.
///
/// Thread-safety: none while it is being changed; a `RZRecordRef` may be read on any thread.
class RZRecord : public NSObject {
 public:
  /// What only the store gives.
  struct Stamp {
    std::string changeTag = {};
    std::optional<NSDate> creationDate = {};
    std::optional<NSDate> modificationDate = {};
  };

  RZRecord(std::string recordType, RZRecordID recordID);
  /// For engines: a record as it is in the store, with no key changed.
  RZRecord(std::string recordType, RZRecordID recordID, RZValues values, Stamp stamp);

  [[nodiscard]] const std::string& recordType() const { return recordType_; }
  [[nodiscard]] const RZRecordID& recordID() const { return recordID_; }
  /// Opaque; another one after each save. Empty: never saved.
  [[nodiscard]] const std::string& changeTag() const { return stamp_.changeTag; }
  /// When the store first took it, by the store's clock. Nil: never saved.
  [[nodiscard]] std::optional<NSDate> creationDate() const { return stamp_.creationDate; }
  /// When the store last took a save of it.
  [[nodiscard]] std::optional<NSDate> modificationDate() const { return stamp_.modificationDate; }

  /// Null: the record has no such key, or it was not among the desired keys of the fetch.
  [[nodiscard]] const RZValue* objectForKey(std::string_view key) const;
  /// The value if it is a T, else null.
  template <typename T>
  [[nodiscard]] const T* valueForKey(std::string_view key) const {
    const RZValue* const value = objectForKey(key);
    return value != nullptr ? std::get_if<T>(value) : nullptr;
  }
  void setObject(RZValue object, const std::string& key);
  void removeObjectForKey(const std::string& key);

  /// The file on this machine that holds the asset under `key`, to be read and never written to.
  /// Nil: its content is not here, or the record did not come from an RZFetchRecordsOperation.
  [[nodiscard]] std::optional<std::string> assetFile(std::string_view key) const;
  /// For what fetches records.
  void setAssetFile(std::string path, const std::string& key);

  [[nodiscard]] const RZValues& values() const { return values_; }
  /// Keys set or removed since the record was made or came from the store.
  [[nodiscard]] const std::set<std::string>& changedKeys() const { return changedKeys_; }
  /// The assets among the values; one that is under two keys is there twice.
  [[nodiscard]] std::vector<RZAsset> assets() const;

  [[nodiscard]] std::string description() const override;

 private:
  std::string recordType_;
  RZRecordID recordID_;
  RZValues values_;
  std::set<std::string> changedKeys_;
  Stamp stamp_;
  std::map<std::string, std::string, std::less<>> assetFiles_;
};

}  // namespace yomber
