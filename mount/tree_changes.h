#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <thread>

#include "mount/kernel_updates.h"
#include "platform/foundation/lock.h"

namespace yomber {

/// Follows what the daemon tells of the tree, for as long as it lives, through as many connections
/// as it takes.
///
/// Between two of them the kernel keeps what it is told for a moment only, and after the next one
/// has begun it looks at everything again. Thread-safety: made and dropped on any one thread.
class TreeChanges {
 public:
  TreeChanges(std::string daemonSocket, FileSystem& files, KernelSession& session);
  ~TreeChanges();
  TreeChanges(const TreeChanges&) = delete;
  TreeChanges& operator=(const TreeChanges&) = delete;

 private:
  struct Link;
  void run();
  /// Returns when the connection has ended; whether there was one that told us.
  bool follow(std::uint64_t number);

  const std::string daemonSocket_;
  const std::shared_ptr<Link> link_;
  std::thread thread_;
};

}  // namespace yomber
