#include "zarn/recent_backups.h"

#include <algorithm>
#include <array>
#include <utility>

namespace yomber {
namespace {

constexpr std::size_t kMaximumEntries = 1000;

}  // namespace

void RecentBackups::setClock(Clock clock) {
  LockGuard guard(mutex_);
  clock_ = clock ? std::move(clock) : [] { return std::chrono::steady_clock::now(); };
}

void RecentBackups::forgetOld() {
  const auto oldest = clock_() - kWindow;
  while (!entries_.empty() &&
         (entries_.front().time < oldest || entries_.size() > kMaximumEntries)) {
    entries_.pop_front();
  }
}

void RecentBackups::note(const ItemRow& document, std::string_view backupName) {
  LockGuard guard(mutex_);
  entries_.push_back(
      {.time = clock_(), .backup = {.document = document, .backupName = std::string(backupName)}});
  forgetOld();
}

std::optional<RecentBackups::Backup> RecentBackups::take(std::uint64_t folder,
                                                         std::string_view name) {
  LockGuard guard(mutex_);
  forgetOld();
  const auto found = std::find_if(entries_.begin(), entries_.end(), [&](const Entry& entry) {
    const ItemRow& document = entry.backup.document;
    return document.parent == folder && document.nameOnDisk() == name;
  });
  if (found == entries_.end()) return std::nullopt;
  Backup backup = std::move(found->backup);
  entries_.erase(found);
  return backup;
}

bool isBackupName(std::string_view backup, std::string_view name) {
  if (name.empty() || backup.empty() || backup == name) return false;
  if (backup.front() == '.' && name.front() != '.') backup.remove_prefix(1);
  constexpr std::array<std::string_view, 5> kEndings{"~", ".bak", ".BAK", ".orig", ".old"};
  const std::size_t dot = name.rfind('.');
  const std::string_view stem =
      dot == std::string_view::npos || dot == 0 ? name : name.substr(0, dot);
  for (const std::string_view ending : kEndings) {
    if (!backup.ends_with(ending)) continue;
    const std::string_view rest = backup.substr(0, backup.size() - ending.size());
    if (rest == name || (ending.front() == '.' && rest == stem)) return true;
  }
  return backup.size() == name.size() + 2 && backup.front() == '#' && backup.back() == '#' &&
         backup.substr(1, name.size()) == name;
}

}  // namespace yomber
