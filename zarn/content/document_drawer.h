#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "platform/drawing/picture_drawer.h"
#include "platform/drawing/program_drawer.h"
#include "platform/foundation/error.h"

namespace yomber {

class InstalledThumbnailers;

/// Draws documents' content: pictures itself, and what a thumbnailer of this machine draws, such as
/// videos, by way of that. Only files of types that are drawn are looked at. The type is that of
/// the name; where that tells nothing, a picture is known by its start.
///
/// Thread-safety: every operation may be called on any thread; `draw` blocks.
class DocumentDrawer {
 public:
  struct Options {
    PictureDrawer::Options pictures = {};
    ProgramDrawer::Options programs = {};
    std::shared_ptr<InstalledThumbnailers> thumbnailers = {};  ///< when null, those of this machine
  };

  DocumentDrawer() : DocumentDrawer(Options()) {}
  explicit DocumentDrawer(const Options& options);

  /// Whether a document of that name may have a thumbnail. Opens no document.
  [[nodiscard]] bool mayDraw(const std::string& name) const;
  /// The same of a document that is open.
  [[nodiscard]] bool mayDraw(const std::string& name, int file) const;

  /// Another number when more may be drawn than before: a thumbnailer came, went or was replaced,
  /// or the library that draws pictures.
  [[nodiscard]] std::int64_t abilities() const;

  /// As PictureDrawer::draw and, for what is drawn by programs, ProgramDrawer::draw. `file` is a
  /// file that has a path, for as long as it is drawn.
  [[nodiscard]] std::optional<DrawnPicture> draw(const std::string& name, int file,
                                                 std::uint32_t side, NSErrorRef* error);

 private:
  [[nodiscard]] FileDescriptor drawnByProgram(const std::string& name, int file, std::uint32_t side,
                                              NSErrorRef* error) const;

  PictureDrawer pictures_;
  const ProgramDrawer programs_;
  const std::shared_ptr<InstalledThumbnailers> ownThumbnailers_;
  InstalledThumbnailers& thumbnailers_;
};

}  // namespace yomber
