#pragma once

#include <memory>
#include <string>
#include <string_view>

namespace yomber {

/// MIME types by file name, from shared-mime-info's `globs2`.
///
/// Thread-safety: immutable after construction.
class ContentTypes {
 public:
  /// Reads `globs2`; without the file every name is application/octet-stream.
  explicit ContentTypes(const std::string& globsPath);
  ~ContentTypes();

  /// The system's own, read once.
  static const ContentTypes& system();

  /// Lives as long as this object.
  [[nodiscard]] const std::string& typeForName(std::string_view name) const;

  static const std::string kFolder;   ///< inode/directory
  static const std::string kSymlink;  ///< inode/symlink
  static const std::string kUnknown;  ///< application/octet-stream

 private:
  struct Table;
  std::unique_ptr<Table> table_;
};

}  // namespace yomber
