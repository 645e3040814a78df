#pragma once

#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/foundation/error.h"
#include "zarn/content/content_core.h"

namespace yomber {

/// A document of a share as a record has it.
struct SharedDocument {
  std::uint64_t id = 0;
  RZAsset content;
  std::int64_t mtime = 0;  ///< ns since the epoch
  std::string tag;
  bool mayWrite = true;
};

/// What shares do to files: everything is made in a private folder, then renamed into its place.
///
/// Nothing is ever replaced that has not been looked at since. For one thread at a time.
class SharedTree {
 public:
  SharedTree(const ContentCore& core, const ContentStore& store);

  /// Makes the document's fault, with the bytes that faults keep, in the private folder. `stamp`:
  /// what to know it by; its ctime changes when it is brought to its place.
  [[nodiscard]] NSErrorRef stage(const SharedDocument& document, std::string& staged,
                                 FileStamp& stamp) const;
  /// The same for a folder.
  [[nodiscard]] NSErrorRef stageFolder(std::uint64_t id, bool mayWrite, std::string& staged) const;
  /// Makes durable what was staged.
  [[nodiscard]] NSErrorRef sync() const;

  /// Brings something into a folder under a name that is free there, which may differ from `name`;
  /// `name` is then the one that it got. Also what is in the tree already. EINVAL for what is no
  /// possible name.
  [[nodiscard]] NSErrorRef place(const std::string& from, const std::string& folder,
                                 std::string& name) const;
  /// Whether what is taken out of the tree is to come back as a copy, however this process ends.
  enum class Kept : bool { No = false, Yes = true };
  /// Puts `staged` where the file at `path` is, whose place in the private folder is `displaced`
  /// then. EBUSY while anybody has that open. `isUntouched`: nobody has come to open it since. What
  /// is no content (permissions, attributes) stays as it was at `path`.
  [[nodiscard]] NSErrorRef replace(const std::string& staged, const std::string& path, Kept kept,
                                   std::string& displaced, bool& isUntouched) const;
  /// Takes something out of the tree. EBUSY, and nothing taken, where a file that is not to be kept
  /// is open elsewhere, or is not as it was `seen`.
  [[nodiscard]] NSErrorRef takeAway(const std::string& path, Kept kept, std::string& taken,
                                    const FileStamp* seen = nullptr) const;
  /// EBUSY where a file is open elsewhere, or is not as it was `seen`.
  [[nodiscard]] static NSErrorRef checkUnused(const std::string& path, const FileStamp& seen);
  /// Removes a folder that holds nothing; ENOTEMPTY otherwise.
  [[nodiscard]] NSErrorRef removeFolder(const std::string& path) const;
  /// The names of all that a folder holds on the disk.
  [[nodiscard]] static NSErrorRef list(const std::string& path, std::vector<std::string>& names);
  /// Brings what was taken away back as an item of its own, next to where it was.
  [[nodiscard]] NSErrorRef keepCopy(const std::string& taken, const std::string& folder,
                                    std::string_view name, std::string& kept) const;
  /// Removes what was taken away or staged; a folder only when it holds nothing.
  void drop(const std::string& taken) const;
  /// Brings what an earlier process took away and has not brought back into the drive's root, and
  /// removes the rest. To be called before anything else.
  void recover() const;

  /// Sets or takes away the owner's right to write.
  void setWritable(const std::string& path, bool mayWrite) const;
  [[nodiscard]] NSErrorRef markShared(const std::string& path, bool isShared) const;

 private:
  static void copyOwnProperties(int from, const std::string& staged);
  [[nodiscard]] static NSErrorRef noteKept(const std::string& path, const std::string& name);
  [[nodiscard]] NSErrorRef takeUnused(const std::string& path, const std::string& taken,
                                      const FileStamp* seen) const;
  [[nodiscard]] std::string newPlace(std::string_view prefix) const;

  const ContentCore& core_;
  const ContentStore& store_;
  const std::string folder_;
};

/// "report.pdf" becomes "report (kept copy).pdf".
[[nodiscard]] std::string keptCopyName(std::string_view name);
/// Whether a name from the store can be one here.
[[nodiscard]] bool isPossibleName(std::string_view name);

}  // namespace yomber
