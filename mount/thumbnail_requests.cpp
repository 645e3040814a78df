#include "mount/thumbnail_requests.h"

#include <utility>

#include "platform/fileprovider/item_codec.h"
#include "platform/fileprovider/thumbnail_taker.h"
#include "platform/ipc/call.h"
#include "platform/ipc/error_codec.h"

namespace yomber {
namespace {

using protocol::Control;

constexpr ipc::CallOptions kPatience{.timeout = std::chrono::minutes(2)};
/// Large enough for what the desktop keeps; the store's thumbnails are larger anyway.
constexpr double kSide = 256;

}  // namespace

ipc::Remote<Control> ThumbnailRequests::control(NSErrorRef* error) {
  if (!connection_ || !connection_->isConnected())
    connection_ = ipc::Connection::connect(controlSocket_, error);
  if (!connection_) return nullptr;
  return connection_->bootstrap<Control>();
}

NSErrorRef ThumbnailRequests::identify(const std::string& location, std::string& identifier) {
  NSErrorRef failure;
  const auto remote = control(&failure);
  if (!remote) return failure;
  NSErrorRef transport = ipc::callAndWait(
      remote, &Control::Client::identifyRequest,
      [&](auto params) { params.setPath(wireData(location)); },
      [&](auto results) {
        const auto result = results.getResult();
        if (result.isError()) {
          failure = ipc::decodeError(result.getError());
        } else {
          identifier = result.getIdentifier().cStr();
        }
      },
      kPatience);
  return transport ? transport : failure;
}

NSErrorRef ThumbnailRequests::fetch(const std::vector<std::string>& identifiers, const Take& take) {
  NSErrorRef failure;
  const auto remote = control(&failure);
  if (!remote) return failure;
  const ThumbnailTaker taker("desktop-thumbnails", [&take](const ItemThumbnail& thumbnail) {
    take(thumbnail.identifier, thumbnail.image);
  });
  NSErrorRef transport = ipc::callAndWait(
      remote, &Control::Client::fetchThumbnailsRequest,
      [&](auto params) {
        auto list = params.initIdentifiers(static_cast<unsigned>(identifiers.size()));
        for (unsigned i = 0; i < list.size(); ++i) list.set(i, wireText(identifiers[i]));
        params.setWidth(kSide);
        params.setHeight(kSide);
        params.setReceiver(taker.receiver());
      },
      [&](auto results) { failure = ipc::decodeOptional(results.getFailure()); }, kPatience);
  return transport ? transport : failure;
}

}  // namespace yomber
