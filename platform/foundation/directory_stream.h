#pragma once

#include <dirent.h>

#include <memory>

#include "platform/foundation/file_descriptor.h"

namespace yomber {

struct CloseDirectory {
  void operator()(DIR* directory) const { closedir(directory); }
};
/// An open directory that is being read. Thread-safety: one thread at a time.
using DirectoryStream = std::unique_ptr<DIR, CloseDirectory>;

/// Reads the directory from its beginning; nil and errno on failure. Takes the descriptor in any
/// case.
[[nodiscard]] DirectoryStream readDirectory(FileDescriptor directory);

/// The next name other than "." and ".."; nil at the end (errno 0) and on failure. Valid until the
/// next call.
[[nodiscard]] const char* nextName(DIR* directory);

}  // namespace yomber
