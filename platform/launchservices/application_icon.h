#pragma once

#include <optional>
#include <string>

#include "platform/foundation/data.h"

namespace yomber {

/// A picture of an application.
struct ApplicationIcon {
  NSDataRef data;  ///< PNG
  /// No icon of a theme but a mere drawing (a symbolic icon, or a picture from elsewhere): whoever
  /// shows it has to make it look like an application's icon.
  bool isBare = false;
};

/// The icon that a `.desktop` file calls `iconName`: a name in the icon theme that is set, those it
/// inherits from and hicolor, or an absolute path. Of several sizes the nearest that is no smaller
/// than `side` (in pixels), scaled down to it; the largest when all are smaller, as it is. Nothing
/// when there is none, or it cannot be drawn.
///
/// Reads files, and may wait for another process that draws. Thread-safety: any thread.
[[nodiscard]] std::optional<ApplicationIcon> bestFittingIcon(const std::string& iconName,
                                                             double side);

}  // namespace yomber
