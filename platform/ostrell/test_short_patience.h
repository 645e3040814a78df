#pragma once

#include <cstdlib>

namespace yomber {

/// While it lives, links to the daemon are made with a time limit that a test can wait for.
class ShortPatience {
 public:
  ShortPatience() { setenv("YOMBER_DAEMON_TIMEOUT_MS", "400", 1); }
  ~ShortPatience() { unsetenv("YOMBER_DAEMON_TIMEOUT_MS"); }
  ShortPatience(const ShortPatience&) = delete;
  ShortPatience& operator=(const ShortPatience&) = delete;
};

}  // namespace yomber
