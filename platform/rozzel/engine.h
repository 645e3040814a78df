#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "platform/foundation/error.h"
#include "platform/foundation/file_descriptor.h"
#include "platform/rozzel/asset.h"
#include "platform/rozzel/errors.h"
#include "platform/rozzel/identifiers.h"
#include "platform/rozzel/record.h"
#include "platform/rozzel/share.h"

namespace yomber {

/// What every engine takes at least; beyond it a call may fail with RZErrorLimitExceeded.
inline constexpr std::size_t RZMaximumNameBytes = 255;  // zone, record and account names, keys
inline constexpr std::size_t RZMaximumRecordBytes = 1 << 20;     // all keys and values; not assets
inline constexpr std::size_t RZMaximumBatchRecords = 2000;       // saves and deletions together
inline constexpr std::size_t RZMaximumPageRecords = 1000;        // larger limits are read as this
inline constexpr std::size_t RZMaximumShareParticipants = 1000;  // the owner among them

enum class RZZonePermission { ReadOnly, ReadWrite };

struct RZRecordZone {
  RZRecordZoneID zoneID;
  /// Opaque; differs after each change in the zone. Comparing it is the cheap way to see whether
  /// the zone's changes are worth asking for.
  std::string changeTag;
  /// What the account that asked may do here.
  RZZonePermission permission = RZZonePermission::ReadWrite;
};

/// Another account that sees a zone.
struct RZZoneMember {
  std::string accountName;
  RZZonePermission permission = RZZonePermission::ReadOnly;
  friend auto operator<=>(const RZZoneMember&, const RZZoneMember&) = default;
};

/// Which keys of a record a fetch brings. None given: all.
using RZDesiredKeys = std::optional<std::vector<std::string>>;

/// One of the records asked for: the record, or why there is none (RZErrorUnknownItem).
struct RZFetchedRecord {
  RZRecordID recordID;
  RZRecordRef record;
  NSErrorRef error;
};

/// What a save does with a record that the store has already. Under every policy only keys that
/// the caller's record holds or has removed are touched, so that saving a record that was fetched
/// with few desired keys loses none of the others.
enum class RZRecordSavePolicy {
  /// Writes the changed keys, if the record's change tag is still the store's; else
  /// RZErrorServerRecordChanged (the store has another) or RZErrorUnknownItem (it was deleted).
  /// A record without a tag must be new.
  IfServerRecordUnchanged,
  /// Writes the changed keys, whatever the tag. Makes the record if there is none.
  ChangedKeys,
  /// Writes all keys that the record holds and removes those it has removed, whatever the tag.
  AllKeys,
};

struct RZRecordDeletion {
  RZRecordID recordID;
  /// Empty: delete whatever is there. Else the deletion is refused with RZErrorServerRecordChanged
  /// when the store's record has another tag.
  std::string changeTag = {};
};

/// Changes that become true together or not at all. They may be in several zones of the database.
/// No record may be in a batch twice.
struct RZRecordBatch {
  std::vector<RZRecordRef> recordsToSave = {};
  /// Deleting what is not there is no error, so that a deletion can safely be repeated.
  std::vector<RZRecordDeletion> recordsToDelete = {};
  RZRecordSavePolicy savePolicy = RZRecordSavePolicy::IfServerRecordUnchanged;
};

/// One change of a zone: the record as it is now, or nil if it was deleted. With an error, it is
/// there and cannot be read (RZErrorStoreDamaged).
struct RZRecordChange {
  RZRecordID recordID;
  std::string recordType;
  RZRecordRef record;
  NSErrorRef error;
};

/// Where a reader of a zone's changes is. Opaque bytes that may be kept for ever; empty: at the
/// beginning.
using RZChangeToken = std::string;

struct RZChangePage {
  /// In the order in which they happened; of a record that changed several times, the last.
  std::vector<RZRecordChange> changes;
  /// Where the next page begins. Given for an empty page too.
  RZChangeToken token;
  bool moreComing = false;
};

struct RZQuery {
  RZRecordZoneID zoneID;
  /// Nil: records of every type.
  std::optional<std::string> recordType = {};
  RZDesiredKeys desiredKeys = {};
};

struct RZQueryPage {
  /// By record name, byte-wise.
  std::vector<RZRecordRef> records;
  /// For the next page; empty: this was the last.
  std::string cursor;
};

struct RZQuota {
  /// Nil: unlimited.
  std::optional<std::uint64_t> limit;
  /// Bytes of all records and of the assets they refer to, in all zones that the account owns; an
  /// asset counts once for each value that refers to it.
  std::uint64_t used = 0;
};

/// Takes the bytes of one asset, one after the other. Dropping it before `finish` leaves nothing.
///
/// Thread-safety: one thread at a time.
class RZAssetWriter {
 public:
  virtual ~RZAssetWriter() = default;
  RZAssetWriter(const RZAssetWriter&) = delete;
  RZAssetWriter& operator=(const RZAssetWriter&) = delete;

  /// Large pieces (256 KiB) are hashed beside being written. Blocks of zeros take no room. After a
  /// failure the writer answers that failure to everything.
  [[nodiscard]] virtual NSErrorRef write(std::span<const std::byte> bytes) = 0;
  /// As many zeros, without passing them.
  [[nodiscard]] virtual NSErrorRef writeZeros(std::uint64_t count) = 0;
  /// Says what was written. The asset is in the store only when its group was committed.
  [[nodiscard]] virtual NSErrorRef finish(RZAsset& asset) = 0;

 protected:
  RZAssetWriter() = default;
};

/// Assets that become durable together. Syncing many at once costs little more than one, so hand
/// in a few hundred small files before each `commit`. Dropping a group without `commit` leaves
/// nothing.
///
/// Thread-safety: writers of one group may be used on different threads, and so may
/// `importAsset`; `commit` comes after all of them.
class RZAssetGroup {
 public:
  virtual ~RZAssetGroup() = default;
  RZAssetGroup(const RZAssetGroup&) = delete;
  RZAssetGroup& operator=(const RZAssetGroup&) = delete;

  /// The writer may outlive neither the group nor its `commit`.
  [[nodiscard]] virtual std::unique_ptr<RZAssetWriter> newWriter(NSErrorRef* error) = 0;
  /// Takes the content of `descriptor` (a regular file, read from its start to its end; its
  /// position is left alone). The asset is what was read, even if the file changes meanwhile:
  /// compare the file's size and times before and after. Holes stay holes; where the file system
  /// can share blocks, they are shared.
  [[nodiscard]] virtual NSErrorRef importAsset(int descriptor, const RZTransfer& transfer,
                                               RZAsset& asset) = 0;
  /// When it answers nil, every finished asset of the group is in the store and on the disk. On
  /// failure some of them may be in the store; importing again is harmless. To be called once.
  [[nodiscard]] virtual NSErrorRef commit() = 0;

 protected:
  RZAssetGroup() = default;
};

struct RZGarbageReport {
  std::uint64_t assetsDropped = 0;
  std::uint64_t bytesDropped = 0;
  /// Records of deleted zones that were cleared away.
  std::uint64_t recordsCleared = 0;
};

/// A record store: what `RZContainer` and `RZDatabase` stand on. Everything a store can do is here,
/// so that another engine can take the place of the embedded one.
///
/// Every call is synchronous; it may take as long as the disk or the network behind it, so it is
/// never made on the loop thread. While the store is out of reach, every call fails at once with
/// RZErrorNetworkUnavailable. Out-parameters are only set on success, except where said.
///
/// Thread-safety: every call may be made on any thread, several at a time, and several processes
/// may use one store. What a call answered nil for, every later call sees.
///
/// Durability: when `modifyRecords` or a zone call answers nil, the change has reached the disk.
/// When it failed, nothing was changed, with one exception that no store can avoid: if the process
/// or connection ends before the answer, the change may have been made.
class RZEngine {
 public:
  virtual ~RZEngine() = default;
  RZEngine(const RZEngine&) = delete;
  RZEngine& operator=(const RZEngine&) = delete;

  /// Nil when the store can be reached now, else RZErrorNetworkUnavailable with the reason. Costs a
  /// few microseconds: made to be polled.
  [[nodiscard]] virtual NSErrorRef checkReachability() = 0;

  // Zones. Only the private database's can be made and deleted.

  /// Makes the zone; one that exists is no error.
  [[nodiscard]] virtual NSErrorRef createZone(const RZDatabaseID& database,
                                              const RZRecordZoneID& zoneID) = 0;
  /// Deletes the zone with its records and members; one that does not exist is no error. A zone
  /// made later under the same name is another one: tokens and tags of the old do not fit it.
  [[nodiscard]] virtual NSErrorRef deleteZone(const RZDatabaseID& database,
                                              const RZRecordZoneID& zoneID) = 0;
  /// All zones of the database by name, then owner.
  [[nodiscard]] virtual NSErrorRef fetchZones(const RZDatabaseID& database,
                                              std::vector<RZRecordZone>& zones) = 0;

  // Records.

  /// One answer for each id, in the same order. Records that are not there do not fail the call; a
  /// zone that is not there makes their error RZErrorZoneNotFound.
  [[nodiscard]] virtual NSErrorRef fetchRecords(const RZDatabaseID& database,
                                                const std::vector<RZRecordID>& recordIDs,
                                                const RZDesiredKeys& desiredKeys,
                                                std::vector<RZFetchedRecord>& records) = 0;
  /// Makes all changes of the batch or none. `saved` gets the records as the store has them now,
  /// in the order of `recordsToSave`. Fails with the first refused record's error (see
  /// `rz_failedRecords` for all of them), among others RZErrorServerRecordChanged,
  /// RZErrorZoneNotFound, RZErrorQuotaExceeded, RZErrorAssetMissing (an asset was not committed
  /// before) and RZErrorPermissionFailure. A record that is damaged in the store, so that reading
  /// it is RZErrorStoreDamaged, is saved over as one without values, and deleted as any other.
  /// Shares are not changed by this.
  [[nodiscard]] virtual NSErrorRef modifyRecords(const RZDatabaseID& database,
                                                 const RZRecordBatch& batch,
                                                 std::vector<RZRecordRef>& saved) = 0;
  /// The changes of a zone after `token`, at most `limit` of them (fewer if they are large).
  /// Starting with an empty token and following `moreComing` brings every record of the zone. A
  /// token that cannot be used: RZErrorChangeTokenExpired.
  [[nodiscard]] virtual NSErrorRef fetchChanges(const RZDatabaseID& database,
                                                const RZRecordZoneID& zoneID,
                                                const RZChangeToken& token, std::size_t limit,
                                                const RZDesiredKeys& desiredKeys,
                                                RZChangePage& page) = 0;
  /// A page of a zone's records after `cursor` (empty: the first). A page costs the same wherever
  /// it is. Records that come or go between two pages may or may not be among them; no other is
  /// left out or brought twice.
  [[nodiscard]] virtual NSErrorRef queryRecords(const RZDatabaseID& database, const RZQuery& query,
                                                const std::string& cursor, std::size_t limit,
                                                RZQueryPage& page) = 0;

  // Members: who else sees a zone. Only through the owner's private database.

  /// Lets an account see the zone in its shared database, or changes its permission.
  [[nodiscard]] virtual NSErrorRef addMember(const RZDatabaseID& database,
                                             const RZRecordZoneID& zoneID,
                                             const RZZoneMember& member) = 0;
  /// Nobody's membership is no error.
  [[nodiscard]] virtual NSErrorRef removeMember(const RZDatabaseID& database,
                                                const RZRecordZoneID& zoneID,
                                                const std::string& accountName) = 0;
  /// By account name.
  [[nodiscard]] virtual NSErrorRef fetchMembers(const RZDatabaseID& database,
                                                const RZRecordZoneID& zoneID,
                                                std::vector<RZZoneMember>& members) = 0;

  // Shares: records that say who sees a zone. They are read and told of as any other record, and
  // changed by these calls alone. A share's members are the members of its zone: whoever has
  // accepted it and has a permission. Membership follows in the same step.

  /// Saves the share of one of the account's own zones, which is made if it is not there. `saved`
  /// is the share as the store has it now.
  ///
  /// Fails with RZErrorServerRecordChanged (`rz_serverRecord` is then the share as it is) when its
  /// change tag is not the store's, RZErrorUnknownItem when it was destroyed,
  /// RZErrorInvalidArguments or RZErrorLimitExceeded for participants that no share can have,
  /// RZErrorPermissionFailure in the shared database. The owner is always the first participant.
  ///
  /// What participants have agreed to is not the saver's to say: somebody new is Pending, whoever
  /// has accepted stays Accepted until he is left out, Removed or given no permission; whoever was
  /// Removed is asked again when he is saved as anything else. Whoever came by the link has the
  /// public permission as long as nobody gives him another.
  [[nodiscard]] virtual NSErrorRef saveShare(const RZDatabaseID& database, const RZShare& share,
                                             RZShareRef& saved) = 0;
  /// The owner's (private database): the share and all membership end, its URL leads nowhere any
  /// more; the zone and its other records stay. RZErrorServerRecordChanged when somebody saved the
  /// share meanwhile. A participant's (shared database): he leaves, and is Removed.
  /// When there is nothing to destroy, or to leave, that is no error.
  [[nodiscard]] virtual NSErrorRef destroyShare(const RZDatabaseID& database,
                                                const RZShare& share) = 0;
  /// The share of a zone. RZErrorUnknownItem: it has none; RZErrorZoneNotFound: it is not there, or
  /// the account may not see it.
  [[nodiscard]] virtual NSErrorRef fetchShare(const RZDatabaseID& database,
                                              const RZRecordZoneID& zoneID, RZShareRef& share) = 0;
  /// Makes the account a member of the zone whose share has that URL: somebody whom the owner added
  /// with the permission that he was given, anybody else with the public permission. Doing so again
  /// is no error. `share` is as the account sees it.
  ///
  /// RZErrorUnknownItem: there is no such share (any more). RZErrorPermissionFailure: it is not for
  /// this account.
  [[nodiscard]] virtual NSErrorRef acceptShare(const std::string& containerIdentifier,
                                               const std::string& accountName,
                                               const std::string& url, RZShareRef& share) = 0;

  // Quota of an account.

  [[nodiscard]] virtual NSErrorRef setQuota(const std::string& accountName,
                                            std::optional<std::uint64_t> limit) = 0;
  [[nodiscard]] virtual NSErrorRef fetchQuota(const std::string& accountName, RZQuota& quota) = 0;

  // Assets. An asset that no record refers to stays for a day at least after it was committed, as
  // long as its engine says. A group must not outlive its engine.

  [[nodiscard]] virtual std::unique_ptr<RZAssetGroup> newAssetGroup(NSErrorRef* error) = 0;
  /// A descriptor for reading the content from its start. Only presence and size are checked: who
  /// needs certainty hashes what it reads, or uses `copyAsset`.
  [[nodiscard]] virtual NSErrorRef openAsset(const RZAsset& asset, FileDescriptor& descriptor) = 0;
  /// Where the content can be read on this machine, in place of a copy: a file that is never
  /// written to, and stays while a committed record refers to the asset. Presence and size are
  /// checked, as above.
  [[nodiscard]] virtual NSErrorRef localFile(const RZAsset& asset, std::string& path) = 0;
  /// Writes the content into `descriptor` (a regular file open for writing; quicker when it is open
  /// for reading too) at the same offsets, and verifies it on the way. The asset's holes are not
  /// written, so the file must read as zeros there; its size is not set. On RZErrorAssetDamaged
  /// wrong bytes have been written: the caller must not let anyone read them. So it is with
  /// NSPOSIXErrorDomain EAGAIN, when somebody else wrote to the file meanwhile and that was
  /// noticed.
  [[nodiscard]] virtual NSErrorRef copyAsset(const RZAsset& asset, int descriptor,
                                             const RZTransfer& transfer) = 0;
  /// The verified content of a small asset in memory; larger than `maximumSize`:
  /// RZErrorLimitExceeded.
  [[nodiscard]] virtual NSErrorRef readAsset(const RZAsset& asset, std::uint64_t maximumSize,
                                             std::string& bytes) = 0;
  /// Reads the whole content. Nil: it is what its hash says.
  [[nodiscard]] virtual NSErrorRef verifyAsset(const RZAsset& asset,
                                               const RZTransfer& transfer) = 0;

  /// Drops assets that no record has referred to for that time, what dead processes left, and what
  /// is left of deleted zones. Never what a committed record refers to. Made to be called now and
  /// then, by whoever has the time; other calls go on meanwhile.
  [[nodiscard]] virtual NSErrorRef collectGarbage(RZGarbageReport& report) = 0;

  // Shorthands.

  /// A group of one.
  [[nodiscard]] NSErrorRef importAsset(int descriptor, const RZTransfer& transfer, RZAsset& asset);
  /// A group of one, from memory.
  [[nodiscard]] NSErrorRef storeAsset(std::span<const std::byte> bytes, RZAsset& asset);

 protected:
  RZEngine() = default;
};

using RZEngineRef = std::shared_ptr<RZEngine>;

}  // namespace yomber
