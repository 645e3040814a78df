#pragma once

#include <cstddef>
#include <optional>
#include <string>

#include "platform/fileprovider/constants.h"
#include "platform/foundation/data.h"
#include "platform/foundation/error.h"

namespace yomber {

/// The thumbnail of one item.
struct ItemThumbnail {
  NSFileProviderItemIdentifier identifier;
  NSDataRef image;                         ///< nil: the item has none
  std::optional<std::string> contentType;  ///< nothing: as the image's bytes say
  NSErrorRef error;                        ///< why there is no image, where something went wrong
};

/// A larger image is refused by whoever would send or take it.
inline constexpr std::size_t kMaximumThumbnailBytes = std::size_t{8} << 20U;

}  // namespace yomber
