#pragma once

#include <sys/types.h>

#include <functional>
#include <memory>
#include <string>

#include "platform/foundation/error.h"
#include "platform/ipc/unix_socket.h"

namespace yomber {

/// A child process that runs the extension. It gets one end of a socket pair, standard output and
/// error, and no other descriptor; it dies with this process.
///
/// The child is reaped by its pid, also after the last reference was dropped.
/// Thread-safety: loop thread only (so that the child is tied to a thread that lives as long as the
/// process).
class ExtensionProcess {
 public:
  /// Starts `program` for the drive at `home`. `socket` is the child's end; this process's copy of
  /// it is closed. `didExit` is called once, with a text like "was ended by signal 9". Null and an
  /// error that names the program when it cannot be started.
  static std::shared_ptr<ExtensionProcess> start(const std::string& program,
                                                 const std::string& home, ipc::UniqueFd socket,
                                                 std::function<void(const std::string&)> didExit,
                                                 NSErrorRef* error);
  ExtensionProcess(const ExtensionProcess&) = delete;
  ExtensionProcess& operator=(const ExtensionProcess&) = delete;
  /// Ends the child.
  ~ExtensionProcess();

  [[nodiscard]] pid_t pid() const;
  /// Ends the child at once; nothing happens when it has ended.
  void end();

 private:
  struct Child;
  explicit ExtensionProcess(std::shared_ptr<Child> child);
  const std::shared_ptr<Child> child_;
};

}  // namespace yomber
