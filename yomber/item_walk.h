#pragma once

#include <functional>
#include <string>

#include "platform/fileprovider/item.h"
#include "platform/foundation/error.h"
#include "yomber/drive_client.h"

namespace yomber {

/// An item that a walk came to, and where it is.
struct WalkedItem {
  ItemFields item;
  std::string path;      ///< its location
  std::string relative;  ///< from where the walk began; empty for the first item
};

/// Calls `visit` for the item that the argument names (see DriveClient::identifierFor) and, for a
/// folder, for all that is below it, folders before what is in them; until it answers false.
/// Bookmarks and other links are not followed, except for the first item, whose location is the
/// target's.
NSErrorRef walkItem(DriveClient& client, const std::string& argument,
                    const std::function<bool(const WalkedItem& found)>& visit);

}  // namespace yomber
