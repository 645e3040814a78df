#pragma once

#include <compare>
#include <cstddef>
#include <functional>
#include <string>
#include <utility>

namespace yomber {

/// The owner name by which an account sees its own zones.
inline constexpr const char* RZCurrentUserDefaultName = "__currentUser__";

/// A zone as an account sees it: its name, and whose it is. Zones of the account itself have the
/// owner RZCurrentUserDefaultName, also when they were asked for under the account's own name.
///
/// Value type, immutable.
class RZRecordZoneID {
 public:
  RZRecordZoneID() = default;
  explicit RZRecordZoneID(std::string zoneName, std::string ownerName = RZCurrentUserDefaultName)
      : zoneName_(std::move(zoneName)), ownerName_(std::move(ownerName)) {}

  [[nodiscard]] const std::string& zoneName() const { return zoneName_; }
  [[nodiscard]] const std::string& ownerName() const { return ownerName_; }
  /// "zone (owner)", for logs.
  [[nodiscard]] std::string description() const;

  friend auto operator<=>(const RZRecordZoneID&, const RZRecordZoneID&) = default;

 private:
  std::string zoneName_;
  std::string ownerName_ = RZCurrentUserDefaultName;
};

/// A record: its name in its zone.
///
/// Value type, immutable.
class RZRecordID {
 public:
  RZRecordID() = default;
  RZRecordID(std::string recordName, RZRecordZoneID zoneID)
      : recordName_(std::move(recordName)), zoneID_(std::move(zoneID)) {}

  [[nodiscard]] const std::string& recordName() const { return recordName_; }
  [[nodiscard]] const RZRecordZoneID& zoneID() const { return zoneID_; }
  /// "record in zone (owner)", for logs.
  [[nodiscard]] std::string description() const;

  friend auto operator<=>(const RZRecordID&, const RZRecordID&) = default;

 private:
  std::string recordName_;
  RZRecordZoneID zoneID_;
};

/// The two databases that an account sees of a container.
enum class RZDatabaseScope {
  Private,  ///< the account's own zones; nobody else sees them unless they are shared
  Shared,   ///< zones of other owners in which the account is a member
};

/// Which database an engine is asked about: everything of one account and one container.
struct RZDatabaseID {
  std::string containerIdentifier;
  std::string accountName;
  RZDatabaseScope scope = RZDatabaseScope::Private;

  friend auto operator<=>(const RZDatabaseID&, const RZDatabaseID&) = default;
};

}  // namespace yomber

template <>
struct std::hash<yomber::RZRecordZoneID> {
  std::size_t operator()(const yomber::RZRecordZoneID& id) const noexcept {
    return std::hash<std::string>{}(id.zoneName()) * 31 + std::hash<std::string>{}(id.ownerName());
  }
};

template <>
struct std::hash<yomber::RZRecordID> {
  std::size_t operator()(const yomber::RZRecordID& id) const noexcept {
    return std::hash<std::string>{}(id.recordName()) * 31 +
           std::hash<yomber::RZRecordZoneID>{}(id.zoneID());
  }
};
