#pragma once

#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "platform/foundation/lock.h"
#include "platform/ostrell/trash_info.h"
#include "zarn/tree_layout.h"

namespace yomber {

/// The trash as it lies on disk (freedesktop.org trash 1.0): what was trashed in `files`, and
/// beside it in `info` what is known about each. Knows no rows.
///
/// Information is written and synced before its item comes, so that a crash leaves at most
/// information about nothing. Other programs work in the same folders.
///
/// Thread-safety: every operation may be called on any thread.
class TrashFolder {
 public:
  explicit TrashFolder(const TreeLayout& layout);

  /// What has come to lie in the trash, or errno.
  struct Taken {
    std::string name;
    int failure = 0;
  };
  /// Moves `diskName` of the open folder into the trash, as `wanted` or, where that name is taken,
  /// one like it. Replaces nothing; after a failure everything is where it was.
  [[nodiscard]] Taken take(int folder, const std::string& diskName, const std::string& wanted,
                           const TrashInfo& info);

  /// What is known about an item in the trash; nothing when others put it there without a word.
  [[nodiscard]] std::optional<TrashInfo> infoOf(const std::string& name) const;
  /// The item has left the trash: drops the information about it, unless another is there by now.
  void didLeave(const std::string& name);
  /// The item has another name in the trash.
  void didRename(const std::string& before, const std::string& after);
  /// Drops information about nothing. Of other programs only what is a minute old: they write it
  /// before the item comes, as we do.
  void dropOrphans();

  /// Moves everything that is in the trash at this moment into the open folder, under other names;
  /// `goesOn` is asked before each. Answers the names that they had, and the first failure.
  struct Emptied {
    std::vector<std::string> names;
    int failure = 0;
  };
  template <typename GoesOn>
  [[nodiscard]] Emptied moveAllTo(int folder, GoesOn goesOn) {
    Emptied result;
    for (const std::string& name : names(files_, result.failure)) {
      if (!goesOn()) break;
      moveTo(folder, name, result);
    }
    return result;
  }

 private:
  enum class Outcome { Done, NameTaken, Failed };
  Outcome takeAs(int folder, const std::string& diskName, const std::string& name,
                 const std::string& info, int& failure);
  [[nodiscard]] int writeInfo(const std::string& path, const std::string& text) const;
  [[nodiscard]] std::string filePath(const std::string& name) const;
  [[nodiscard]] std::string infoPath(const std::string& name) const;
  [[nodiscard]] bool isInTrash(const std::string& name) const;
  [[nodiscard]] bool isOrphan(const std::string& name) const;
  void moveTo(int folder, const std::string& name, Emptied& result) const;
  static std::vector<std::string> names(const std::string& folder, int& failure);

  const TreeLayout layout_;
  const std::string files_;
  const std::string info_;

  mutable Mutex mutex_;
  /// Names whose information is written and whose item is about to come.
  std::set<std::string> coming_ GUARDED_BY(mutex_);
};

}  // namespace yomber
