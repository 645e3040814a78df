#pragma once

#include <sys/types.h>

#include <cerrno>
#include <optional>
#include <string>

#include "platform/foundation/error.h"

namespace yomber {

/// A file that its owner may not write to, made writable for a moment: only so can its attributes
/// and its content be changed by whoever is not root.
///
/// That is noted on the disk first, so that a process that ends meanwhile leaves no file writable
/// for good: `restoreLentModes`. Thread-safety: one object is for one thread at a time; several
/// objects may lend one file.
class LentMode {
 public:
  /// Lends where it is needed: a file, folder or link opened in any way (O_PATH too), of this user,
  /// that its owner may not write to. Otherwise nothing, and errno says why: EACCES when lending
  /// would not help.
  static std::optional<LentMode> lend(int file);
  /// Puts the mode back, unless somebody has changed it meanwhile.
  ~LentMode();
  LentMode(LentMode&& other) noexcept;
  LentMode& operator=(LentMode&&) = delete;

 private:
  LentMode() = default;
  int file_ = -1;  ///< a duplicate
  mode_t own_ = 0;
  std::string note_;  ///< empty: nobody has said where notes are kept
};

/// What `change` answers (errno), with the file lent to it when it would be refused otherwise.
template <typename Change>
int withWritePermission(int file, const Change& change) {
  const int failure = change();
  if (failure != EACCES) return failure;
  const auto lent = LentMode::lend(file);
  // Without one, somebody else may have had it lent just then, and put it back.
  return change();
}

/// Where is noted what is lent: a private folder on any file system, made when it is missing. Any
/// thread; before the first file is lent.
void setLentModesFolder(std::string path);
/// Puts back what an earlier process has lent and not put back. To be called before anything is
/// lent.
void restoreLentModes();

}  // namespace yomber
