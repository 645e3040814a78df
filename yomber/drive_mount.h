#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "platform/foundation/drive_paths.h"
#include "platform/foundation/error.h"

namespace yomber {

/// The mount of a drive: there is at most one. Used on the main thread.

/// Where the drive is mounted; nothing when it is not.
[[nodiscard]] std::optional<std::string> mountPointOf(const DrivePaths& paths);

struct MountOptions {
  std::string folder;  ///< absolute
  bool allowOthers = false;
  bool mayPassThrough = true;         ///< the kernel may read and write what is here by itself
  std::optional<std::uint64_t> keep;  ///< bytes of content on this disk, at most; nothing: any
};
/// Returns when the mount can be used. Fails with what to do; the drive is then not mounted.
[[nodiscard]] NSErrorRef mountDrive(const DrivePaths& paths, const MountOptions& options);
/// Whether a mount is taken away that processes have something open in. That stays as it is on the
/// disk, but cannot be used through the mount any more.
enum class MayBeInUse : bool { No, Yes };
/// Fails with EBUSY, and with who has something open, when it may not be in use but is.
[[nodiscard]] NSErrorRef unmountDrive(const DrivePaths& paths, MayBeInUse mayBeInUse,
                                      bool& wasMounted);

}  // namespace yomber
