#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "platform/foundation/error.h"
#include "platform/foundation/lock.h"
#include "platform/rozzel/engine.h"

namespace yomber {

/// A document as the store has it; in zones that others see, also a folder.
struct StoredDocument {
  std::uint64_t item = 0;
  RZRecordZoneID zone;  ///< of the container or share that it is in
  std::optional<RZRecordZoneID> previousZone =
      {};  ///< where its record was until now, if elsewhere
  std::uint64_t parent = 0;
  std::string name;
  std::int64_t mtime = 0;                 ///< ns since the epoch
  std::int64_t btime = 0;                 ///< ns since the epoch
  RZAsset content;                        ///< not of folders
  std::optional<RZAsset> thumbnail = {};  ///< nothing: the record is to have none
  bool isFolder = false;
  /// Its name and its folder are no business of others.
  bool isPlacedByEach = false;
  /// In zones that others write to: the tag of the record that it replaces; empty: it is new.
  std::string tag = {};
  /// The same of the record where it was: another one than this is not removed.
  std::string previousTag = {};
};

/// The thumbnail of a document that the store has already.
struct RecordThumbnail {
  std::uint64_t item = 0;
  RZRecordZoneID zone;
  RZAsset content;  ///< of which it is
  RZAsset thumbnail;
};

struct RemovedDocument {
  std::uint64_t item = 0;
  RZRecordZoneID zone;
  std::string tag = {};  ///< of the record as it is known here; empty: whatever is there
};

/// One account's documents in the record store: a record for each, named by its id, in a zone for
/// each container, in the account's private database. What is in a share has its records in the
/// share's zone, which is in the shared database when somebody else owns it.
///
/// Failures are those that the drive's users know: NSCocoaErrorDomain 4354 (out of reach), 4355
/// (quota), 259 (damaged or missing), 3072 (cancelled), NSPOSIXErrorDomain ENOSPC; the store's own
/// error is the underlying one. Thread-safety: every operation may be called on any thread.
class ContentStore {
 public:
  ContentStore(RZEngineRef engine, const std::string& account);

  /// For what is to be said to the store itself.
  [[nodiscard]] const RZEngineRef& engine() const { return engine_; }
  [[nodiscard]] const std::string& account() const { return database_.accountName; }
  /// The database that has the zone.
  [[nodiscard]] RZDatabaseID databaseOf(const RZRecordZoneID& zone) const;
  [[nodiscard]] RZDatabaseID databaseOf(RZDatabaseScope scope) const;

  /// Nil when the store can be reached now. Cheap.
  [[nodiscard]] NSErrorRef checkReachability() const;

  /// NSCocoaErrorDomain 4355 when the quota of the zone's owner has no room for content of `size`
  /// bytes in place of content of `replaced` bytes. A save may be refused all the same.
  [[nodiscard]] NSErrorRef checkRoom(const RZRecordZoneID& zone, std::uint64_t size,
                                     std::uint64_t replaced) const;

  /// Assets that become durable together, with `commit`; null with an error.
  [[nodiscard]] std::unique_ptr<RZAssetGroup> newGroup(NSErrorRef* error) const;
  /// `goesOn` is given the bytes done; answering false ends the transfer with 3072.
  using GoesOn = std::function<bool(std::uint64_t)>;
  [[nodiscard]] NSErrorRef take(RZAssetGroup& group, int file, const GoesOn& goesOn,
                                RZAsset& content) const;
  [[nodiscard]] NSErrorRef commit(RZAssetGroup& group) const;

  /// What came of each document: its record's tag, or why it was refused. A record of a share that
  /// somebody else has changed meanwhile is RZErrorServerRecordChanged, one that he has deleted
  /// RZErrorUnknownItem.
  struct Saved {
    std::string tag;
    NSErrorRef error;
    /// It is saved, and what was refused is the removal of the record that it had elsewhere.
    bool isPreviousLeft = false;
  };
  /// Durable when it returns. `saved` gets an answer for each document, in order; the error is of
  /// the store itself, when it cannot be reached.
  [[nodiscard]] NSErrorRef save(const std::vector<StoredDocument>& documents,
                                std::vector<Saved>& saved);
  /// The same for records that are there. What is gone, has other content meanwhile, or has one
  /// already is left as it is, with neither tag nor error.
  [[nodiscard]] NSErrorRef saveThumbnails(const std::vector<RecordThumbnail>& thumbnails,
                                          std::vector<Saved>& saved);
  /// The same; `refused` gets an error, or nil, for each. Removing what is not there is a success.
  [[nodiscard]] NSErrorRef remove(const std::vector<RemovedDocument>& removed,
                                  std::vector<NSErrorRef>& refused);

  /// The share of that zone.
  [[nodiscard]] NSErrorRef fetchShare(const RZRecordZoneID& zone, RZShareRef& share) const;

  /// Writes verified content into an open file; see RZEngine::copyAsset.
  [[nodiscard]] NSErrorRef copy(const RZAsset& content, int file, const GoesOn& goesOn) const;
  /// Nil when the store has the content, every byte of it.
  [[nodiscard]] NSErrorRef verify(const RZAsset& content) const;
  /// For reading from its start; not verified.
  [[nodiscard]] NSErrorRef open(const RZAsset& content, FileDescriptor& descriptor) const;

 private:
  /// Documents that one batch may hold, and what came of them.
  struct Part {
    std::vector<const StoredDocument*> documents;
    std::vector<Saved*> saved;
  };
  NSErrorRef savePart(const Part& part);
  NSErrorRef saveBatch(const Part& part, std::size_t begin, std::size_t end);
  NSErrorRef saveAlone(const StoredDocument& document, NSErrorRef error, Saved& saved);
  NSErrorRef removePrevious(const StoredDocument& document, Saved& saved);
  NSErrorRef saveThumbnail(const RZRecordRef& record, const RecordThumbnail& wanted, Saved& saved);
  NSErrorRef removeBatch(const std::vector<RemovedDocument>& removed, std::size_t begin,
                         std::size_t end, std::vector<NSErrorRef>& refused);
  NSErrorRef makeZones(const RZRecordBatch& batch);
  NSErrorRef modify(const RZDatabaseID& database, const RZRecordBatch& batch,
                    std::vector<RZRecordRef>& saved);

  const RZEngineRef engine_;
  const RZDatabaseID database_;
  Mutex mutex_;
  std::set<std::string> zones_ GUARDED_BY(mutex_);  ///< known to exist
};

/// The same failure as the drive's users know it.
[[nodiscard]] NSErrorRef contentError(NSErrorRef error);
[[nodiscard]] bool isOutOfReach(const NSErrorRef& error);
[[nodiscard]] bool isOverQuota(const NSErrorRef& error);

}  // namespace yomber
