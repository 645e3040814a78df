#pragma once

#include <functional>
#include <string>
#include <vector>

#include "platform/fileprovider/constants.h"
#include "platform/foundation/error.h"
#include "platform/rozzel/share.h"
#include "yomber/drive_client.h"

namespace yomber {

/// Sharing, for commands: by an item's service where it has one that does it, else through the
/// client library.
///
/// Used on the main thread only; every call blocks until it is answered.
class DriveSharing {
 public:
  explicit DriveSharing(DriveClient& client);

  /// The item's share; a new one, not known to the store, when it has none.
  NSErrorRef share(const NSFileProviderItemIdentifier& identifier, RZShareRef& share);
  NSErrorRef participants(const NSFileProviderItemIdentifier& identifier,
                          std::vector<RZShareParticipant>& participants);
  /// Saves what `change` makes of the item's share; when somebody else saved it meanwhile, what it
  /// makes of that.
  NSErrorRef change(const NSFileProviderItemIdentifier& identifier,
                    const std::function<void(RZShare& share)>& change, RZShareRef& saved);
  NSErrorRef link(const NSFileProviderItemIdentifier& identifier, std::string& url);
  /// Also when somebody else saved the share meanwhile.
  NSErrorRef stop(const NSFileProviderItemIdentifier& identifier);
  NSErrorRef accept(const std::string& url, NSFileProviderItemIdentifier& identifier);
  NSErrorRef sharedWithMe(std::vector<RZShareRef>& shares);

 private:
  DriveClient& client_;
};

}  // namespace yomber
