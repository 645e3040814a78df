#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/rozzel/identifiers.h"
#include "zarn/connection.h"
#include "zarn/item_row.h"

namespace yomber {

// How shares are stored that the drive takes part in. All throw SQLite::Exception; what changes
// something needs the writer's connection.

/// A shared item of the drive: the zone of its records, and how far that zone's changes are known
/// here.
struct ShareRow {
  enum class State : std::uint8_t {
    Active,
    Leaving,  ///< no longer shared: what follows from that is still to be done
  };

  std::uint64_t root = 0;  ///< the shared item
  std::int64_t account = 0;
  RZRecordZoneID zone;
  State state = State::Active;
  bool mayWrite = true;
  bool isFolder = false;
  std::string title;
  std::string token;  ///< up to where the zone's changes were taken over
  /// Of the zone when there were no more; of others' not empty once the item itself was put here.
  std::string zoneTag;

  [[nodiscard]] bool isOwn() const { return zone.ownerName() == RZCurrentUserDefaultName; }
  [[nodiscard]] bool isLeaving() const { return state == State::Leaving; }
};

/// Whether what is in the shared item belongs into the share's zone. What somebody else shared
/// stays his until it has gone.
[[nodiscard]] inline bool givesItsZone(const ShareRow& share) {
  return !share.isOwn() || !share.isLeaving();
}

[[nodiscard]] bool hasShares(Connection& connection);
/// The share whose item that is itself; whosever.
[[nodiscard]] std::optional<ShareRow> findShare(Connection& connection, std::uint64_t root);
[[nodiscard]] std::optional<ShareRow> findShareOfZone(Connection& connection, std::int64_t account,
                                                      const RZRecordZoneID& zone);
[[nodiscard]] std::vector<ShareRow> findShares(Connection& connection, std::int64_t account);
/// Those of all accounts that were ever signed in here.
[[nodiscard]] std::vector<ShareRow> findShares(Connection& connection);
/// The share that an item belongs to: its own, or that of the nearest folder above it; whosever.
[[nodiscard]] std::optional<ShareRow> findShareAbove(Connection& connection, std::uint64_t id);
/// What the rows from an item upwards say about the zone of an account's record. Of no account:
/// what they say to whichever takes part in the share.
struct ZoneSource {
  RZRecordZoneID zone;            ///< without a name: neither a share nor a container
  std::optional<ShareRow> share;  ///< whose zone it is
};
[[nodiscard]] ZoneSource findZoneSource(Connection& connection, const std::vector<ItemRow>& rows,
                                        std::optional<std::int64_t> account);
void storeShare(Connection& connection, const ShareRow& row);
/// With the records that wait in it.
void removeShare(Connection& connection, std::uint64_t root);

/// Whether a zone is one that others see, rather than a container's.
[[nodiscard]] bool isSharedZone(const RZRecordZoneID& zone);
/// How many items have a record in a shared zone.
[[nodiscard]] std::uint64_t countContentIn(Connection& connection, const RZRecordZoneID& zone);

/// The items that have one there, but are not here, about which nothing is to be done.
[[nodiscard]] std::vector<std::uint64_t> findLostContent(Connection& connection,
                                                         const ShareRow& share);
/// The items that have one there.
[[nodiscard]] std::vector<std::uint64_t> contentIn(Connection& connection,
                                                   const RZRecordZoneID& zone);

// Records of a share that could not be taken over yet. Times are ns since the epoch.

/// To be asked for with the next pass: its file is open, or has just changed.
void addWaitingRecord(Connection& connection, std::uint64_t root, std::uint64_t record);
/// The same, unless it waits already.
void keepWaitingRecord(Connection& connection, std::uint64_t root, std::uint64_t record);
/// What must come for it is not known, as its folder: to be asked for again after three seconds,
/// then after twice the time, at most an hour; after a dozen times no more by itself.
void postponeWaitingRecord(Connection& connection, std::uint64_t root, std::uint64_t record,
                           std::int64_t now);
void removeWaitingRecord(Connection& connection, std::uint64_t root, std::uint64_t record);
/// Of a share, as one of its folders has come; of all of an account, as somebody asks for them.
void makeWaitingRecordsDue(Connection& connection, std::uint64_t root);
void makeAllWaitingRecordsDue(Connection& connection, std::int64_t account);
[[nodiscard]] bool hasPostponedRecords(Connection& connection, std::int64_t account);
[[nodiscard]] bool hasWaitingRecords(Connection& connection, std::uint64_t root);
/// Those due at `now`, first those that have been so for longest.
[[nodiscard]] std::vector<std::uint64_t> findWaitingRecords(Connection& connection,
                                                            std::uint64_t root, std::int64_t now,
                                                            std::size_t limit);

}  // namespace yomber
