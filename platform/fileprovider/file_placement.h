#pragma once

#include <optional>
#include <string>

#include "platform/fileprovider/file_operations.h"
#include "platform/foundation/error.h"
#include "platform/foundation/url.h"

namespace yomber {

/// A location and where it is on this disk.
struct FileLocation {
  NSURLRef logical;
  std::string onDisk;
};

/// A name in a folder that a file is to get.
struct FileDestination {
  FileLocation folder;
  std::string name;
  Bouncing bouncing = Bouncing::Forbidden;
};

/// What an operation made of it.
struct Placed {
  NSURLRef url;  ///< logical
  NSErrorRef error;
};

// The framework's file operations themselves. They block; errors are those of file_operations.h.
// Thread-safety: any thread.

/// Where the location is on this disk, by its physical mark.
[[nodiscard]] FileLocation locateFile(const NSURLRef& url);
/// The same for a folder that receives something, which may have another name here without a mark
/// saying so.
[[nodiscard]] FileLocation locateFolder(const NSURLRef& url);

/// See FormerNameResolver; nothing as well for a name that no file can have.
[[nodiscard]] std::optional<std::string> formerNameOf(const FileLocation& file);

[[nodiscard]] Placed makeFolder(const FileDestination& destination);
[[nodiscard]] Placed moveFile(const FileLocation& source, const FileDestination& destination);
/// In its folder. The name that it has already is no clash with itself.
[[nodiscard]] Placed renameFile(const FileLocation& source, const std::string& newName);
[[nodiscard]] Placed importFile(const FileLocation& source, const FileDestination& destination);
[[nodiscard]] NSErrorRef deleteFile(const FileLocation& file);
[[nodiscard]] NSErrorRef checkFileIsThere(const FileLocation& file);

}  // namespace yomber
