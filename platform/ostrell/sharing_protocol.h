#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "platform/foundation/error.h"
#include "platform/rozzel/share.h"

namespace yomber {

/// What the daemon says of sharing; the calls and failures of protocols/sharing.capnp. What is done
/// with one share are the operations of share_operations.h. Each call either replies or fails its
/// proxy, once.
class QSSharingProtocol {
 public:
  using ShareOptionsReply =
      std::function<void(bool isShared, bool mayWrite, bool isSharedItself,
                         const std::optional<std::string>& folderName, NSErrorRef error)>;

  virtual ~QSSharingProtocol() = default;

  /// Whether the folder with that id can be shared; when not, the error may say why.
  virtual void checkIfItemIsShareableWithInode(
      std::uint64_t rawID, std::function<void(bool shareable, NSErrorRef error)> reply) = 0;
  /// Replies when what the store has of the item's sharing is known here. As long as that takes.
  virtual void refreshSharingStateForItemIdentifier(const std::string& identifier,
                                                    std::function<void(NSErrorRef)> reply) = 0;
  /// Whether the item belongs to a share, whether this account may write to it, whether the share
  /// is its own rather than a folder's, and the shared folder's name.
  virtual void getShareOptionsOfItemIdentifier(const std::string& identifier,
                                               ShareOptionsReply reply) = 0;
  /// The shares of others in which this account takes part.
  virtual void sharesWithMeWithReply(
      std::function<void(const std::vector<RZShareRef>& shares, NSErrorRef error)> reply) = 0;
};

}  // namespace yomber
