#pragma once

#include <memory>
#include <vector>

#include "platform/fileprovider/extension.h"
#include "platform/ipc/remote.h"
#include "protocols/thumbnails.capnp.h"

namespace yomber {

/// Asks the extension for thumbnails and tells the receiver of each; the promise is the failure of
/// the whole, once the receiver took the last one. Dropping the promise cancels the request.
///
/// Loop thread only.
[[nodiscard]] kj::Promise<NSErrorRef> requestThumbnails(
    std::shared_ptr<NSFileProviderExtension> extension,
    std::vector<NSFileProviderItemIdentifier> identifiers, CGSize size,
    ipc::Remote<protocol::ThumbnailReceiver> receiver);

}  // namespace yomber
