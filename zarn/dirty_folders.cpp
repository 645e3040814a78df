#include "zarn/dirty_folders.h"

#include <algorithm>

namespace yomber {

namespace {

/// A folder with more dirty names than this is read whole.
constexpr std::size_t kMaximumNames = 32768;
/// More files than this being written at a time are scanned at once.
constexpr std::size_t kMaximumModified = 16384;
/// The two ends of a move are queued one right after the other.
constexpr std::chrono::milliseconds kMoveWait{3};

}  // namespace

DirtyFolders::DirtyFolders(std::chrono::milliseconds modifyInterval)
    : modifyInterval_(modifyInterval) {}

void DirtyFolders::noteName(std::uint64_t folder, std::string_view name) {
  Entry& entry = folders_[folder];
  if (entry.isWhole) return;
  if (entry.names.size() >= kMaximumNames) return noteWhole(folder);
  if (!entry.names.contains(name)) entry.names.emplace(name);
}

void DirtyFolders::noteWhole(std::uint64_t folder) {
  Entry& entry = folders_[folder];
  entry.isWhole = true;
  entry.names.clear();
}

void DirtyFolders::noteDeep(std::uint64_t folder) {
  noteWhole(folder);
  folders_[folder].isDeep = true;
}

void DirtyFolders::noteModify(std::uint64_t folder, std::string_view name, Clock::time_point now) {
  if (modified_.size() >= kMaximumModified) return noteName(folder, name);
  const auto [at, isNew] = modified_.try_emplace(Place(folder, name), now + modifyInterval_);
  if (isNew) modifiedByTime_.emplace_back(at->second, at->first);
}

void DirtyFolders::noteMovedFrom(std::uint32_t cookie, Clock::time_point now) {
  openMoves_.push_back({cookie, now + kMoveWait});
}

void DirtyFolders::noteMovedTo(std::uint32_t cookie) {
  std::erase_if(openMoves_, [cookie](const OpenMove& move) { return move.cookie == cookie; });
}

void DirtyFolders::forget(std::uint64_t folder) { folders_.erase(folder); }

void DirtyFolders::clear() {
  folders_.clear();
  openMoves_.clear();
  modified_.clear();
  modifiedByTime_.clear();
}

std::optional<DirtyFolders::Clock::time_point> DirtyFolders::dueTime() const {
  std::optional<Clock::time_point> due;
  if (!folders_.empty()) {
    // Moves whose other end is outside the tree never get it: only the newest wait counts, and
    // moves that follow each other closely do not put it off for good.
    due = openMoves_.empty() ? Clock::time_point::min() : openMoves_.front().waitsUntil;
  }
  if (!modifiedByTime_.empty()) {
    due = due ? std::min(*due, modifiedByTime_.front().first) : modifiedByTime_.front().first;
  }
  return due;
}

void DirtyFolders::promoteModified(Clock::time_point now) {
  while (!modifiedByTime_.empty() && modifiedByTime_.front().first <= now) {
    const auto place = modifiedByTime_.front().second;
    modifiedByTime_.pop_front();
    modified_.erase(place);
    noteName(place.first, place.second);
  }
}

std::vector<DirtyFolder> DirtyFolders::take(Clock::time_point now) {
  promoteModified(now);
  while (!openMoves_.empty() && openMoves_.front().waitsUntil <= now) openMoves_.pop_front();
  std::vector<DirtyFolder> result;
  result.reserve(folders_.size());
  for (auto& [id, entry] : folders_) {
    DirtyFolder folder{.id = id, .isWhole = entry.isWhole, .isDeep = entry.isDeep, .names = {}};
    folder.names.reserve(entry.names.size());
    while (!entry.names.empty()) {
      folder.names.push_back(std::move(entry.names.extract(entry.names.begin()).value()));
    }
    result.push_back(std::move(folder));
  }
  folders_.clear();
  return result;
}

}  // namespace yomber
