#pragma once

namespace yomber::testing {

/// How the mounts of a test are made. YOMBER_MOUNT says it ("cached", "user"); without, it is what
/// the machine gives whoever runs the test.
enum class MountKind {
  Best,    ///< root's, with pass-through where the kernel knows it
  Cached,  ///< root's, without
  User,    ///< an ordinary user's, through fusermount3: without privilege, and for nobody else
};
[[nodiscard]] MountKind mountKind();

}  // namespace yomber::testing
