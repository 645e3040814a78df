#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <vector>

#include "platform/fileprovider/item.h"
#include "platform/foundation/error.h"
#include "platform/foundation/progress.h"
#include "platform/foundation/url.h"
#include "platform/rozzel/share.h"
#include "platform/xpc/interface.h"

namespace yomber {

/// The service by which an item is shared.
inline constexpr const char* QSSharingServiceName = "com.kelvo.Ostrell.SharingV1";

using QSSharingInfoReply =
    std::function<void(bool shared, NSFileProviderItemRef item, NSErrorRef error)>;
using QSShareablePreflightReply = std::function<void(
    bool shareable, NSFileProviderItemRef item, const std::vector<NSFileProviderItemRef>& first,
    const std::vector<NSFileProviderItemRef>& second, NSErrorRef error)>;
/// `publicPermission` is an RZShareParticipantPermission, or 0 when there is no share.
using QSParticipantsReply = std::function<void(const std::vector<RZShareParticipant>& participants,
                                               std::int64_t publicPermission, NSErrorRef error)>;
using QSShareReply = std::function<void(RZShareRef share, NSErrorRef error)>;
using QSShareURLReply = std::function<void(NSURLRef url, NSErrorRef error)>;
using QSErrorReply = std::function<void(NSErrorRef error)>;

/// What that service does for one item.
///
/// Implemented by the extension for each connection, and by the proxy that a client calls. Every
/// reply given is called once, on any thread. A progress that is answered calls the work off when
/// it is cancelled, and then the reply brings the error; nil: there is nothing to call off.
class QSSharingServiceV1 {
 public:
  virtual ~QSSharingServiceV1() = default;

  virtual void fetchSharingInfo(QSSharingInfoReply reply) = 0;
  /// Whether the item is shared now.
  virtual NSProgressRef preflightCheckIfCurrentlyShareableWithCompletion(
      QSShareablePreflightReply completion) = 0;
  virtual NSProgressRef fetchParticipantListAndPublicPermission(QSParticipantsReply reply) = 0;
  virtual void startPreparingForShareWhenForcing(bool forcing) = 0;
  /// The item's share; a new one that the store knows nothing of when it has none.
  virtual NSProgressRef fetchShareWithCompletion(QSShareReply completion) = 0;
  virtual NSProgressRef fetchShareURLWithCompletion(QSShareURLReply completion) = 0;
  /// NSPOSIXErrorDomain 45 for shares of folders, which are saved through the client library.
  virtual NSProgressRef saveShare(const RZShareRef& share, QSShareReply completion) = 0;
  /// No error when there is nothing to unshare.
  virtual NSProgressRef unshareWithCompletion(QSErrorReply completion) = 0;
};

/// How QSSharingServiceV1 travels.
[[nodiscard]] NSXPCInterfaceRef getSharingServiceInterface();

}  // namespace yomber
