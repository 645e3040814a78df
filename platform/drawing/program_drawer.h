#pragma once

#include <chrono>
#include <cstdint>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/foundation/error.h"
#include "platform/foundation/file_descriptor.h"

namespace yomber {

/// Draws with programs that are installed on this machine, as thumbnailers of videos are.
///
/// A program runs confined, by bubblewrap: it sees the machine's programs and libraries, the one
/// file, and an empty one for what it draws; no network, no other process, no setting and no other
/// file, and it has no rights to get any. Its time, each process's memory, and what it writes, also
/// for itself, are limited. What it wrote is nobody's picture yet: a PictureDrawer makes one of it.
///
/// What programs draw goes through files in the temporary folder, which end with their use; those
/// that a killed process left are removed by the first `draw` of another object.
///
/// Thread-safety: every operation may be called on any thread; `draw` blocks.
class ProgramDrawer {
 public:
  struct Options {
    std::string confiner = "/usr/bin/bwrap";
    std::chrono::milliseconds patience{30'000};        ///< for one picture
    std::uint32_t processorSeconds = 20;               ///< of each process
    std::uint64_t memory = std::uint64_t{4} << 30;     ///< bytes of addresses, of each process
    std::uint64_t fileSize = std::uint64_t{64} << 20;  ///< bytes of the result, and beside it
  };

  ProgramDrawer() : ProgramDrawer(Options()) {}
  explicit ProgramDrawer(Options options) : options_(std::move(options)) {}

  /// Whether there is what confines programs. Without it none is run.
  [[nodiscard]] bool isAvailable() const;

  /// Has `command` draw the file at `path`: a program and its arguments, in which "%i" stands for
  /// the file, "%u" for its URL, "%o" for the result and "%s" for `side`, pixels. `name` is the
  /// document's own, of which the program sees the extension. The answer is a file in memory.
  ///
  /// Nothing, with an error: NSCocoaErrorDomain 259 when nothing was drawn; NSPOSIXErrorDomain
  /// ETIME when it took too long, EIO when it was killed, ENOEXEC when it cannot be run here, other
  /// codes when no program can.
  [[nodiscard]] FileDescriptor draw(const std::vector<std::string>& command,
                                    const std::string& path, const std::string& name,
                                    std::uint32_t side, NSErrorRef* error = nullptr) const;

 private:
  /// What confines, up to the files that are brought in.
  [[nodiscard]] std::vector<std::string> confinement() const;
  /// Nil when it ended well.
  [[nodiscard]] NSErrorRef run(const std::vector<std::string>& words) const;
  [[nodiscard]] NSErrorRef checkProgram(const std::string& program) const;

  const Options options_;
  const std::unique_ptr<std::once_flag> swept_ = std::make_unique<std::once_flag>();
};

}  // namespace yomber
