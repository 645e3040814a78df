#pragma once

#include <chrono>
#include <string>

#include "platform/drawing/drawing_protocol.h"
#include "platform/drawing/spawned_process.h"
#include "platform/foundation/error.h"
#include "platform/foundation/file_descriptor.h"

namespace yomber {

/// One process that draws, and the socket to it. Destroying it kills and reaps the process.
///
/// Thread-safety: one thread at a time.
class DrawingProcess {
 public:
  /// Its environment holds nothing of ours.
  [[nodiscard]] NSErrorRef start(const std::string& program);
  /// False once it has ended.
  [[nodiscard]] bool isAlive() { return process_.isAlive(); }
  /// False when it has ended.
  [[nodiscard]] bool send(const drawing::Request& request, int input, int output);
  /// Kills the process when it has not answered by then (NSPOSIXErrorDomain ETIME); that of `end`
  /// when it ended instead, EPROTO for what is no answer.
  [[nodiscard]] NSErrorRef receive(drawing::Reply& reply, std::chrono::milliseconds patience);
  /// Makes an end of it: ENOEXEC when it had ended by itself with a failure, else EIO.
  [[nodiscard]] NSErrorRef end();
  /// Whether it ended of its own accord, with nothing to do.
  [[nodiscard]] bool hasRetired() const { return process_.exitCode() == 0; }

 private:
  SpawnedProcess process_;
  FileDescriptor socket_;
};

}  // namespace yomber
