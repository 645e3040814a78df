#pragma once

#include <memory>

#include "platform/fileprovider/constants.h"
#include "platform/ostrell/collaboration_service.h"
#include "yomber/drive_client.h"
#include "yomber/service_client.h"

namespace yomber {

using CollaborationClient = ServiceClient<QSFileProviderPandrelCollaboration>;

/// The collaboration service of a document; null with an error that says why it has none.
[[nodiscard]] std::unique_ptr<CollaborationClient> openCollaboration(
    DriveClient& client, const NSFileProviderItemIdentifier& identifier, NSErrorRef* error);

}  // namespace yomber
