#pragma once

#include <chrono>
#include <cstdint>
#include <deque>
#include <functional>
#include <optional>
#include <string>
#include <string_view>

#include "platform/foundation/lock.h"
#include "zarn/item_row.h"

namespace yomber {

/// Documents that were just renamed to the name of a backup, as editors do before they write a
/// document anew under its old name: the new file is the document then, and the backup is not.
///
/// Thread-safety: every operation may be called on any thread.
class RecentBackups {
 public:
  using Clock = std::function<std::chrono::steady_clock::time_point()>;
  /// For how long the old name is waited for.
  static constexpr std::chrono::seconds kWindow{2};

  /// When empty, the machine's.
  void setClock(Clock clock);

  /// `document` is as it was before.
  void note(const ItemRow& document, std::string_view backupName);

  struct Backup {
    ItemRow document;  ///< as it was before
    std::string backupName;
  };
  /// The document that had this name until a moment ago; asked for once.
  [[nodiscard]] std::optional<Backup> take(std::uint64_t folder, std::string_view name);

 private:
  struct Entry {
    std::chrono::steady_clock::time_point time;
    Backup backup;
  };
  void forgetOld() REQUIRES(mutex_);

  Mutex mutex_;
  Clock clock_ GUARDED_BY(mutex_) = [] { return std::chrono::steady_clock::now(); };
  std::deque<Entry> entries_ GUARDED_BY(mutex_);  // oldest first
};

/// Whether editors keep what was in the file `name` as `backup`: "name~", "name.bak", "name.orig",
/// "#name#", ".name.bak" and the like, and "stem.bak" for "stem.ext".
[[nodiscard]] bool isBackupName(std::string_view backup, std::string_view name);

}  // namespace yomber
