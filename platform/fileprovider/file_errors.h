#pragma once

#include <string>

#include "platform/foundation/error.h"
#include "platform/foundation/url.h"

namespace yomber {

// The errors of the framework's file operations, as file_operations.h lists them.

enum class FileAccess { Read, Write };

/// What an errno of an operation on `path` is for a caller.
[[nodiscard]] NSErrorRef fileError(int number, const std::string& path,
                                   FileAccess access = FileAccess::Write);
/// The same for an error of the foundation's file operations: those of the POSIX domain are
/// translated, others pass. Nil stays nil.
[[nodiscard]] NSErrorRef fileErrorFrom(const NSErrorRef& error, FileAccess access);
/// A clash with what is at `inTheWay`.
[[nodiscard]] NSErrorRef fileExistsError(const NSURLRef& inTheWay);
[[nodiscard]] NSErrorRef noSuchFileError(const std::string& path);

/// Nil when a file can have that name, else why not.
[[nodiscard]] NSErrorRef checkFileName(const std::string& name);

}  // namespace yomber
