#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "platform/foundation/date.h"
#include "platform/foundation/error.h"
#include "platform/foundation/url.h"

namespace yomber {

/// How an item's content stands.
struct QSContentState {
  enum class Local : std::uint8_t { Here, Fault, Downloading, Evicting };
  enum class Upload : std::uint8_t {
    Confirmed,  ///< the store has this very content
    Waiting,
    Uploading,
    None,  ///< never uploaded: folders, links, excluded names
  };
  Local local = Local::Here;
  Upload upload = Upload::None;
  bool isPinned = false;
  std::uint64_t size = 0;        ///< bytes
  std::uint64_t localBytes = 0;  ///< of blocks on this disk
  NSErrorRef lastFailure;        ///< of the job that waits to be tried again
};

/// One upload, download or eviction that is under way or waits to be tried again.
struct QSTransfer {
  enum class Kind : std::uint8_t { Upload, Download, Evict };
  NSURLRef url;
  Kind kind = Kind::Upload;
  std::uint64_t total = 0;  ///< bytes
  std::uint64_t done = 0;
  std::uint32_t attempts = 0;
  NSErrorRef failure;  ///< of the last attempt
  std::optional<NSDate> nextAttempt;
};

struct QSTransfers {
  std::vector<QSTransfer> transfers;  ///< at most 1000
  std::uint64_t waiting = 0;          ///< jobs
  std::uint64_t finished = 0;         ///< jobs, since the daemon started
};

/// Whether a container's Documents folder is made where it is missing.
enum class RecreateDocuments : bool { No = false, Yes = true };

using QSErrorReply = std::function<void(NSErrorRef error)>;
using QSURLReply = std::function<void(NSURLRef url, NSErrorRef error)>;

/// What the daemon does with the content of items, and with items as such, for its clients; the
/// calls and failures of protocols/content.capnp. Providing content is QSFileProvidingOperation's.
/// Locations must not be nil. Each call either replies or fails its proxy, once.
class QSContentProtocol {
 public:
  virtual ~QSContentProtocol() = default;

  /// Replies when the downloads have begun; see `QSStartDownloadForItemsWithOptions`.
  virtual void startDownloadingItemsAtURLs(const std::vector<NSURLRef>& urls, std::uint64_t options,
                                           QSErrorReply reply) = 0;
  /// Gives up the local content. QSOstrellErrorCannotEvict says why that cannot be.
  virtual void evictItemAtURL(const NSURLRef& url, QSErrorReply reply) = 0;
  virtual void setPinned(bool pinned, const NSURLRef& onItemAtURL, QSErrorReply reply) = 0;
  virtual void contentStateOfItemAtURL(
      const NSURLRef& url, std::function<void(const QSContentState& state, NSErrorRef)> reply) = 0;
  virtual void transfersWithReply(std::function<void(const QSTransfers& transfers)> reply) = 0;

  /// `capability` has the bits of QSMoveCapability; `toURL` is the location after the move.
  virtual void capabilityToMoveItemAtURL(
      const NSURLRef& url, const NSURLRef& toURL,
      std::function<void(std::uint32_t capability, NSErrorRef)> reply) = 0;
  /// Replies where the item is in the trash.
  virtual void trashItemAtURL(const NSURLRef& url, QSURLReply reply) = 0;
  /// Replies where the trashed item came from; that folder may be gone.
  virtual void putBackURLForTrashedItemAtURL(const NSURLRef& url, QSURLReply reply) = 0;
  virtual void emptyTrashWithReply(
      std::function<void(std::uint64_t removed, NSErrorRef)> reply) = 0;
  /// Replies where the item with that logical location is on this disk.
  virtual void physicalURLForItemAtURL(const NSURLRef& url, QSURLReply reply) = 0;

  /// Replies the container's folder, its display name and the generation of the list of containers.
  virtual void getContainerURLForID(const std::string& containerID,
                                    RecreateDocuments recreateDocumentsIfNeeded,
                                    std::function<void(NSURLRef url, const std::string& displayName,
                                                       std::uint64_t generation, NSErrorRef error)>
                                        reply) = 0;

  // Each replaces what was there; without a value (no names) it is taken away.
  virtual void setLastUsedDate(const std::optional<NSDate>& date, const NSURLRef& onItemAtURL,
                               QSErrorReply reply) = 0;
  virtual void setFavoriteRank(const std::optional<std::int64_t>& rank, const NSURLRef& onItemAtURL,
                               QSErrorReply reply) = 0;
  virtual void setTagNames(const std::vector<std::string>& names, const NSURLRef& onItemAtURL,
                           QSErrorReply reply) = 0;
};

}  // namespace yomber
