#pragma once

#include <sys/types.h>

#include <cstdint>
#include <string>
#include <string_view>
#include <unordered_map>
#include <utility>
#include <vector>

#include "platform/foundation/lock.h"

namespace yomber {

/// The thumbnailers that are installed on this machine: files `*.thumbnailer` that name a program
/// and the MIME types that it draws. Of several files with one name the first counts.
///
/// Folders and files are looked at again with each question, and read again when they changed.
/// Thread-safety: every operation may be called on any thread; it reads files.
class InstalledThumbnailers {
 public:
  /// `directories` in the order in which they count. `aliasesPath` is shared-mime-info's list of
  /// other names of types.
  explicit InstalledThumbnailers(std::vector<std::string> directories,
                                 std::string aliasesPath = "/usr/share/mime/aliases");

  /// This user's and this machine's.
  static InstalledThumbnailers& system();

  /// Whether one draws the type, and the program that it asks for is there.
  [[nodiscard]] bool canDraw(std::string_view type) { return !commandFor(type).empty(); }
  /// The command of the first that does, as its file has it: a program and its arguments, with
  /// "%i",
  /// "%u", "%o" and "%s" for the file, its URL, the result and its size. Empty: none.
  [[nodiscard]] std::vector<std::string> commandFor(std::string_view type);
  /// All types that one draws whose program is there, sorted.
  [[nodiscard]] std::vector<std::string> types();
  /// Another text when a thumbnailer came, went, or was replaced by another version.
  [[nodiscard]] std::string versions();

 private:
  /// What tells that a file or folder was changed; nothing for what is not there.
  struct Stamp {
    ino_t inode = 0;
    std::int64_t mtime = 0;
    std::int64_t ctime = 0;
    friend bool operator==(const Stamp&, const Stamp&) = default;
  };
  struct Thumbnailer {
    std::string program;  ///< has to be there; an empty name needs none
    std::vector<std::string> command;
  };
  using Stamps = std::vector<std::pair<std::string, Stamp>>;

  static Stamp stampOf(const std::string& path);
  [[nodiscard]] bool isChanged() const REQUIRES(mutex_);
  void readAll() REQUIRES(mutex_);
  void readDirectory(const std::string& directory, std::vector<std::string>& seen) REQUIRES(mutex_);
  void readThumbnailer(const std::string& path) REQUIRES(mutex_);
  void readAliases() REQUIRES(mutex_);
  [[nodiscard]] std::string canonical(std::string_view type) const REQUIRES(mutex_);

  const std::vector<std::string> directories_;
  const std::string aliasesPath_;
  Mutex mutex_;
  Stamps stamps_ GUARDED_BY(mutex_);
  /// The thumbnailers of a type, by canonical type.
  std::unordered_map<std::string, std::vector<Thumbnailer>> thumbnailers_ GUARDED_BY(mutex_);
  std::unordered_map<std::string, std::string> aliases_ GUARDED_BY(mutex_);
};

}  // namespace yomber
