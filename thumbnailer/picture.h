#pragma once

#include "platform/drawing/drawing_protocol.h"

/// Drawing small pictures, with libvips.
///
/// Thread-safety: one thread.
namespace yomber::thumbnailer {

/// Makes libvips ready, with the few kinds of files that are drawn and no others. False when it
/// cannot be.
[[nodiscard]] bool prepare();

/// Draws something of every kind, so that all modules, fonts and tables are loaded that drawing
/// needs: later no file can be opened.
void warmUp();

/// Draws what is in `input` and writes it to `output`; neither is closed.
[[nodiscard]] drawing::Reply draw(const drawing::Request& request, int input, int output);

}  // namespace yomber::thumbnailer
