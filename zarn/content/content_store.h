#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <set>
#include <string>
#include <vector>

#include "platform/foundation/error.h"
#include "platform/foundation/lock.h"
#include "platform/rozzel/engine.h"

namespace yomber {

/// A document as the store has it.
struct StoredDocument {
  std::uint64_t item = 0;
  std::string zone;          ///< the container that it belongs to
  std::string previousZone;  ///< where its record was until now; empty: nowhere else
  std::uint64_t parent = 0;
  std::string name;
  std::int64_t mtime = 0;  ///< ns since the epoch
  std::int64_t btime = 0;  ///< ns since the epoch
  RZAsset content;
};

struct RemovedDocument {
  std::uint64_t item = 0;
  std::string zone;
};

/// One account's documents in the record store: a record for each, named by its id, in a zone for
/// each container, in the account's private database.
///
/// Failures are those that the drive's users know: NSCocoaErrorDomain 4354 (out of reach), 4355
/// (quota), 259 (damaged or missing), 3072 (cancelled), NSPOSIXErrorDomain ENOSPC; the store's own
/// error is the underlying one. Thread-safety: every operation may be called on any thread.
class ContentStore {
 public:
  ContentStore(RZEngineRef engine, const std::string& account);

  /// Nil when the store can be reached now. Cheap.
  [[nodiscard]] NSErrorRef checkReachability() const;

  /// Assets that become durable together, with `commit`; null with an error.
  [[nodiscard]] std::unique_ptr<RZAssetGroup> newGroup(NSErrorRef* error) const;
  /// `goesOn` is given the bytes done; answering false ends the transfer with 3072.
  using GoesOn = std::function<bool(std::uint64_t)>;
  [[nodiscard]] NSErrorRef take(RZAssetGroup& group, int file, const GoesOn& goesOn,
                                RZAsset& content) const;
  [[nodiscard]] NSErrorRef commit(RZAssetGroup& group) const;

  /// What came of each document: its record's tag, or why it was refused.
  struct Saved {
    std::string tag;
    NSErrorRef error;
  };
  /// Durable when it returns. `saved` gets an answer for each document, in order; the error is of
  /// the store itself, when it cannot be reached.
  [[nodiscard]] NSErrorRef save(const std::vector<StoredDocument>& documents,
                                std::vector<Saved>& saved);
  /// The same; `refused` gets an error, or nil, for each. Removing what is not there is a success.
  [[nodiscard]] NSErrorRef remove(const std::vector<RemovedDocument>& removed,
                                  std::vector<NSErrorRef>& refused);

  /// Writes verified content into an open file; see RZEngine::copyAsset.
  [[nodiscard]] NSErrorRef copy(const RZAsset& content, int file, const GoesOn& goesOn) const;
  /// For reading from its start; not verified.
  [[nodiscard]] NSErrorRef open(const RZAsset& content, FileDescriptor& descriptor) const;

 private:
  NSErrorRef saveBatch(const std::vector<StoredDocument>& documents, std::size_t begin,
                       std::size_t end, std::vector<Saved>& saved);
  NSErrorRef removeBatch(const std::vector<RemovedDocument>& removed, std::size_t begin,
                         std::size_t end, std::vector<NSErrorRef>& refused);
  NSErrorRef makeZones(const RZRecordBatch& batch);
  NSErrorRef modify(const RZRecordBatch& batch, std::vector<RZRecordRef>& saved);

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
