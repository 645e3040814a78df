#include "yomber/drive_thumbnails.h"

#include <algorithm>
#include <utility>

#include "platform/fileprovider/item_codec.h"
#include "platform/fileprovider/thumbnail_taker.h"
#include "platform/ipc/error_codec.h"
#include "yomber/patient_call.h"

namespace yomber {

namespace {

using protocol::Control;

/// The host takes no more at a time.
constexpr std::size_t atATime = 50'000;

}  // namespace

NSErrorRef fetchThumbnails(DriveClient& client,
                           const std::vector<NSFileProviderItemIdentifier>& identifiers,
                           CGSize size, const ThumbnailTaker::Take& take) {
  NSErrorRef failure;
  const auto control = client.control(&failure);
  if (!control) return failure;
  const ThumbnailTaker taker("thumbnails", take);
  NSErrorRef transport;
  for (std::size_t begin = 0; begin < identifiers.size() && !transport; begin += atATime) {
    const std::size_t end = std::min(begin + atATime, identifiers.size());
    transport = callPatiently(
        control, &Control::Client::fetchThumbnailsRequest,
        [&](Control::FetchThumbnailsParams::Builder params) {
          auto list = params.initIdentifiers(static_cast<unsigned>(end - begin));
          for (unsigned i = 0; i < list.size(); ++i) {
            list.set(i, wireText(identifiers[begin + i]));
          }
          params.setWidth(size.width);
          params.setHeight(size.height);
          params.setReceiver(taker.receiver());
        },
        [&](auto results) {
          if (auto error = ipc::decodeOptional(results.getFailure())) failure = std::move(error);
        },
        questionForHost(control));
  }
  return transport ? transport : failure;
}

}  // namespace yomber
