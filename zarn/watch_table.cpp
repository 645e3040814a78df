#include "zarn/watch_table.h"

#include <sys/stat.h>

#include <algorithm>
#include <bit>
#include <cerrno>
#include <cstdio>
#include <fstream>
#include <utility>

namespace yomber {

namespace {

// Without IN_DONT_FOLLOW: the folder is named through /proc by a descriptor that was opened without
// following, which cannot be exchanged for something else meanwhile.
constexpr std::uint32_t kMask = IN_CREATE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO |
                                IN_CLOSE_WRITE | IN_ATTRIB | IN_MODIFY | IN_DELETE_SELF |
                                IN_ONLYDIR | IN_EXCL_UNLINK;
/// Readings whose folder turned out to be gone are never identified: of those without a watch only
/// so many are remembered.
constexpr std::size_t kMaximumUnwatchedVisits = 65536;

std::uint64_t systemLimit(const char* name) {
  std::ifstream file(std::string("/proc/sys/fs/inotify/") + name);
  std::uint64_t value = 0;
  file >> value;
  return value;
}

std::uint64_t inodeOf(int descriptor) {
  struct stat status{};
  return fstat(descriptor, &status) == 0 ? status.st_ino : 0;
}

std::string raiseAdvice(const char* setting, std::uint64_t value) {
  const std::string assignment = std::string("fs.inotify.") + setting + "=" + std::to_string(value);
  return "raise fs.inotify." + std::string(setting) + " to at least " + std::to_string(value) +
         " (sudo sysctl " + assignment + ")";
}

}  // namespace

WatchTable::WatchTable(std::size_t limit)
    : limit_(limit), queue_(inotify_init1(IN_NONBLOCK | IN_CLOEXEC)) {
  if (!queue_) shortage_ = Shortage::Instances;
}

int WatchTable::add(int folderDescriptor) {
  if (!queue_) return -1;
  char path[32];
  std::snprintf(path, sizeof path, "/proc/self/fd/%d", folderDescriptor);
  const int watch = inotify_add_watch(queue_.get(), path, kMask);
  if (watch < 0) {
    shortage_ = Shortage::Watches;
  } else if (watches_.size() >= limit_ && !watches_.contains(watch)) {
    inotify_rm_watch(queue_.get(), watch);
    shortage_ = Shortage::OwnLimit;
    return -1;
  }
  return watch;
}

void WatchTable::setUnwatchedVisit(std::uint64_t visit) {
  if (unwatchedVisits_.size() >= kMaximumUnwatchedVisits) {
    unwatchedVisits_.erase(unwatchedVisits_.begin());
  }
  unwatchedVisits_.insert(visit);
}

std::uint64_t WatchTable::willRead(std::uint64_t visit, int folderDescriptor) {
  const int descriptor = add(folderDescriptor);
  if (descriptor < 0) {
    setUnwatchedVisit(visit);
    return 0;
  }
  const auto [at, isNew] = watches_.try_emplace(descriptor);
  at->second.visits.push_back(visit);
  byVisit_[visit] = descriptor;
  if (!isNew) return 0;
  return at->second.inode = inodeOf(folderDescriptor);
}

bool WatchTable::didIdentify(std::uint64_t visit, std::uint64_t id) {
  if (unwatchedVisits_.erase(visit) != 0) {
    if (!byID_.contains(id)) unwatched_.insert(id);
    return false;
  }
  const auto found = byVisit_.find(visit);
  if (found == byVisit_.end()) return false;
  const int descriptor = found->second;
  byVisit_.erase(found);
  bind(descriptor, id);
  Watch& watch = watches_.at(descriptor);
  std::erase(watch.visits, visit);
  if (!watch.visits.empty()) return watch.sawEvent;
  return std::exchange(watch.sawEvent, false);
}

/// From now on the watch's events are the folder's.
void WatchTable::bind(int descriptor, std::uint64_t id) {
  unwatched_.erase(id);
  if (watches_.at(descriptor).id == id) return;
  forget(id);
  unbind(descriptor);
  watches_.at(descriptor).id = id;
  byID_[id] = descriptor;
}

void WatchTable::unbind(int descriptor) {
  Watch& watch = watches_.at(descriptor);
  if (!watch.id) return;
  byID_.erase(*watch.id);
  watch.id.reset();
}

void WatchTable::forget(std::uint64_t id) {
  unwatched_.erase(id);
  const auto found = byID_.find(id);
  if (found == byID_.end()) return;
  const int descriptor = found->second;
  unbind(descriptor);
  // Being read again, the folder came back under another id: the watch is still wanted.
  if (!watches_.at(descriptor).visits.empty()) return;
  watches_.erase(descriptor);
  inotify_rm_watch(queue_.get(), descriptor);
}

std::optional<std::uint64_t> WatchTable::folderOfEvent(int descriptor) {
  const auto found = watches_.find(descriptor);
  if (found == watches_.end()) return std::nullopt;
  if (!found->second.visits.empty()) found->second.sawEvent = true;
  return found->second.id;
}

std::uint64_t WatchTable::inodeOfEvent(int descriptor) const {
  const auto found = watches_.find(descriptor);
  return found == watches_.end() ? 0 : found->second.inode;
}

void WatchTable::didDrop(int descriptor) {
  const auto found = watches_.find(descriptor);
  if (found == watches_.end()) return;
  for (const auto visit : found->second.visits) byVisit_.erase(visit);
  unbind(descriptor);
  watches_.erase(found);
}

std::string WatchTable::advice() const {
  if (unwatched_.empty()) return {};
  const std::uint64_t folders = byID_.size() + unwatched_.size();
  const std::string consequence = std::to_string(unwatched_.size()) +
                                  " folders cannot be watched and are scanned from time to time: ";
  switch (shortage_) {
    case Shortage::Instances:
      return consequence +
             raiseAdvice("max_user_instances", systemLimit("max_user_instances") * 2 + 128);
    case Shortage::OwnLimit:
      return consequence + "raise --watch-limit to at least " + std::to_string(folders);
    default:
      // Other programs of the user need watches too.
      return consequence +
             raiseAdvice("max_user_watches",
                         std::bit_ceil(std::max(folders, systemLimit("max_user_watches")) + 8192));
  }
}

}  // namespace yomber
