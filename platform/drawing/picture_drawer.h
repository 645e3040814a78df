#pragma once

#include <chrono>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/drawing/drawing_protocol.h"
#include "platform/foundation/error.h"
#include "platform/foundation/file_descriptor.h"
#include "platform/foundation/lock.h"

namespace yomber {

/// A small picture of a file.
struct DrawnPicture {
  FileDescriptor file;  ///< in memory, sealed against changes, at its start
  std::uint64_t length = 0;
  std::uint32_t width = 0;
  std::uint32_t height = 0;
  bool isPNG = false;  ///< else JPEG
};

/// Draws small pictures of files: pictures, drawings, and the first pages of documents.
///
/// No picture is decoded in this process: it goes to `yomber-thumbnailer`, which can reach nothing
/// but the descriptors that it is given. Such a process is started when it is wanted, draws one
/// picture after the other, and ends when it has had nothing to do for a while. One that takes too
/// long is killed; that, a crash and damaged input cost the one picture and nothing else.
///
/// Thread-safety: `draw` may be called on any thread, by several at once, each with a process of
/// its own; it blocks while the picture is drawn.
class PictureDrawer {
 public:
  struct Options {
    std::string program;                         ///< empty: yomber-thumbnailer beside this program
    std::chrono::milliseconds patience{15'000};  ///< for one picture
    std::uint32_t processorSeconds = 10;         ///< for one picture
    std::uint64_t pixels = std::uint64_t{1} << 28;
    std::uint64_t bytes = std::uint64_t{2} << 20;  ///< of the result
    unsigned picturesOfAProcess = 500;             ///< then another takes its place
    unsigned idleProcesses = 2;                    ///< that are kept for the next picture
  };

  PictureDrawer() : PictureDrawer(Options()) {}
  explicit PictureDrawer(Options options);
  /// Ends the processes; nobody may be drawing.
  ~PictureDrawer();
  PictureDrawer(const PictureDrawer&) = delete;
  PictureDrawer& operator=(const PictureDrawer&) = delete;

  /// The picture in `file`, upright, in sRGB, at most `side` pixels high and wide, pixels never
  /// enlarged. `file` is read from its start, by offset.
  ///
  /// Nothing, with an error: NSCocoaErrorDomain 259 for what cannot be drawn (another attempt is of
  /// no use); NSPOSIXErrorDomain EFBIG for too many pixels, ETIME when it took too long, EIO when
  /// the process died of it, other codes when there is no process to draw with.
  [[nodiscard]] std::optional<DrawnPicture> draw(int file, std::uint32_t side, drawing::Form form,
                                                 NSErrorRef* error = nullptr);
  /// Another text when pictures of other kinds may be drawn than before: of the libraries that are
  /// installed, and their modules. Nothing where they are not where they were built for.
  [[nodiscard]] static std::string libraries();

 private:
  class Process;

  std::unique_ptr<Process> takeProcess(NSErrorRef* error);
  void giveBack(std::unique_ptr<Process> process);

  const Options options_;
  Mutex mutex_;
  std::vector<std::unique_ptr<Process>> idle_ GUARDED_BY(mutex_);
};

}  // namespace yomber
