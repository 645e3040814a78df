#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <unordered_map>
#include <utility>
#include <vector>

#include "platform/foundation/data.h"
#include "platform/foundation/error.h"
#include "platform/foundation/url.h"
#include "platform/ostrell/content_protocol.h"
#include "platform/ostrell/file_object_id.h"
#include "platform/ostrell/item_notifications.h"
#include "platform/ostrell/query_item.h"
#include "platform/ostrell/sharing_protocol.h"
#include "platform/rozzel/identifiers.h"

namespace yomber {

/// How the daemon orders a listing.
inline constexpr std::uint8_t QSSortOrderByName = 0;
inline constexpr std::uint8_t QSSortOrderByDate = 1;

using QSPageHandler =
    std::function<void(const QSQueryItems& items, std::uint64_t nextOffset, NSErrorRef error)>;

/// Where the store has the content of documents: the record of each one, by its id.
///
/// Ownership: shared, immutable.
class QSContentRecordIDs final : public NSObject {
 public:
  using Map =
      std::unordered_map<QSFileObjectIDRef, RZRecordID, QSFileObjectIDHash, QSFileObjectIDEqual>;
  explicit QSContentRecordIDs(Map recordIDs) : recordIDs_(std::move(recordIDs)) {}

  [[nodiscard]] const Map& recordIDs() const { return recordIDs_; }
  /// "{d:5 = record in zone (owner), …}".
  [[nodiscard]] std::string description() const override;

 private:
  const Map recordIDs_;
};
using QSContentRecordIDsRef = std::shared_ptr<const QSContentRecordIDs>;

/// What the daemon does for its clients. Implemented by the asynchronous and the synchronous proxy.
/// Each call either replies or fails its proxy, once.
class QSDaemonProtocol : public QSContentProtocol, public QSSharingProtocol {
 public:
  virtual void getURLForItemIdentifier(const std::string& identifier,
                                       std::function<void(NSURLRef, NSErrorRef)> reply) = 0;
  /// `folder` is nil for the root. `limit` is at most 1000.
  virtual void enumerateItemsInFolder(const QSFileObjectIDRef& folder, std::uint8_t sortOrder,
                                      std::uint64_t offset, std::uint32_t limit,
                                      QSPageHandler completion) = 0;
  virtual void enumerateAllFoldersWithSortOrder(std::uint8_t sortOrder, std::uint64_t offset,
                                                std::uint32_t limit, QSPageHandler completion) = 0;
  virtual void currentNotifRankWithReply(
      std::function<void(std::uint64_t rank, NSErrorRef)> reply) = 0;
  /// `token` is nil to start from the beginning.
  virtual void enumerateWorkingSetChangesFromChangeToken(
      const NSDataRef& token, std::uint32_t limit,
      std::function<void(const QSQueryItems& updated, const std::vector<QSFileObjectIDRef>& deleted,
                         NSDataRef token, NSErrorRef)>
          completion) = 0;
  /// Documents whose content the store does not have are left out of what is replied; nil when the
  /// daemon cannot say.
  virtual void resolveFileObjectIDsToContentRecordIDs(
      const std::vector<QSFileObjectIDRef>& fileObjectIDs,
      std::function<void(QSContentRecordIDsRef recordIDs, NSErrorRef)> reply) = 0;
  /// The receiver is held weakly; when it is gone, its subscription ends. The dictionary is
  /// reserved.
  virtual void getItemUpdateSenderWithReceiver(
      std::shared_ptr<QSItemNotificationReceiving> receiver,
      std::function<void(QSItemUpdateSenderRef sender,
                         const std::map<std::string, std::string>& info, NSErrorRef)>
          reply) = 0;
};

/// An asynchronous proxy: calls return at once, replies come on the connection's reply queue.
using QSDaemonProxyRef = std::shared_ptr<QSDaemonProtocol>;

/// A synchronous proxy: a call returns after its reply handler has run, on the calling thread, or
/// after the call failed. The reply handler stores what came with `set…Result`. One call at a time;
/// made for one use.
class QSDaemonSyncProxy : public QSDaemonProtocol {
 public:
  virtual void setObjResult(NSObjectRef result, NSErrorRef error) = 0;
  virtual void setBoolResult(bool result, NSErrorRef error) = 0;
  [[nodiscard]] virtual NSObjectRef result() const = 0;
  [[nodiscard]] virtual bool boolResult() const = 0;
  /// What the reply handler stored, or the transport failure.
  [[nodiscard]] virtual NSErrorRef error() const = 0;
};

using QSDaemonSyncProxyRef = std::shared_ptr<QSDaemonSyncProxy>;

/// This process's connection to the daemon. Connects on first use and again after a loss; callers
/// share an attempt, and fail at once when it fails. A daemon that does not answer in time (30
/// seconds, or YOMBER_DAEMON_TIMEOUT_MS milliseconds) fails the call with NSXPCConnectionTimedOut.
///
/// Thread-safety: every operation may be called on any thread; none of them may wait for the daemon
/// on the loop thread. Ownership: lives as long as the process.
class QSDaemonConnection {
 public:
  static QSDaemonConnection& defaultConnection();
  /// Makes the default connection one to the drive at `home` from now on, instead of the one at the
  /// default home. What was connected and kept before is dropped. Programs that are told a home
  /// call it before anything else of the library.
  static void setDefaultHome(const std::string& home);
  virtual ~QSDaemonConnection() = default;

  /// `errorHandler` takes the transport failure of a call made on the proxy, at most once a proxy.
  virtual QSDaemonProxyRef remoteObjectProxyWithErrorHandler(
      std::function<void(NSErrorRef)> errorHandler) = 0;
  virtual QSDaemonSyncProxyRef newSyncProxy() = 0;
};

}  // namespace yomber
