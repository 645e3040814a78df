#include "mount/desktop_thumbnails.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <utility>

#include "platform/drawing/drawable_types.h"
#include "platform/foundation/background_thread.h"
#include "platform/foundation/fault_attributes.h"
#include "platform/foundation/fault_points.h"
#include "platform/foundation/file_descriptor.h"
#include "platform/foundation/log.h"
#include "platform/glimmet/content_types.h"
#include "platform/glimmet/installed_thumbnailers.h"
#include "platform/ostrell/user_defaults.h"

namespace yomber {
namespace {

/// So many are asked for at a time.
constexpr std::size_t kTogether = 64;
/// What waits beyond that is found when its folder is listed.
constexpr std::size_t kLooks = 10'000;
constexpr int kDeepest = 256;
/// Most thumbnails that come later come soon; each pause is this many times the last.
constexpr std::chrono::seconds kFirstPause{30};
constexpr int kLongerEachTime = 4;
/// What is not there after hours is a file of which there is none.
constexpr int kLooksAgain = 5;
constexpr std::size_t kMissed = 1000;
using Flavour = ThumbnailCache::Flavour;
/// What file managers look for. Larger ones would take as much room as the pictures themselves.
constexpr std::array kFlavours{Flavour::Large, Flavour::Normal};

/// Without the pause, the folder is looked at again at once.
FaultPoint pauseSkipped("mount.thumbnail.missed");
FaultPoint lookingAgain("mount.thumbnail.again");

std::chrono::seconds pauseBefore(int lookAgain) {
  if (pauseSkipped.hit()) return std::chrono::seconds::zero();
  auto pause = kFirstPause;
  for (int i = 1; i < lookAgain; ++i) pause *= kLongerEachTime;
  return pause;
}

std::string joined(const std::string& folder, const std::string& name) {
  return folder + "/" + name;
}

FileDescriptor fileOf(std::string_view bytes) {
  FileDescriptor file(memfd_create("yomber-picture", MFD_CLOEXEC));
  while (file && !bytes.empty()) {
    const ssize_t count = write(file.get(), bytes.data(), bytes.size());
    if (count <= 0) return {};
    bytes.remove_prefix(static_cast<std::size_t>(count));
  }
  return file;
}

std::string contentOf(const DrawnPicture& picture) {
  std::string bytes(picture.length, '\0');
  const ssize_t count = pread(picture.file.get(), bytes.data(), bytes.size(), 0);
  return std::cmp_equal(count, bytes.size()) ? bytes : std::string();
}

}  // namespace

DesktopThumbnails::DesktopThumbnails(const Places& places, std::string mountPoint,
                                     std::string controlSocket, ThumbnailCache cache)
    : places_(places),
      mountPoint_(std::move(mountPoint)),
      cache_(std::move(cache)),
      requests_(std::move(controlSocket)),
      largest_(QSRemoteUserDefaults::sharedDefaults().minFileSizeForThumbnailTransfer()),
      thread_([this] { run(); }) {}

DesktopThumbnails::~DesktopThumbnails() {
  {
    LockGuard guard(mutex_);
    isEnding_ = true;
    changed_.notifyAll();
  }
  thread_.join();
}

void DesktopThumbnails::noteListing(Folder folder) { note({std::move(folder), {}}); }

void DesktopThumbnails::noteChange(Folder folder, std::string name) {
  note({std::move(folder), std::move(name)});
}

bool DesktopThumbnails::isUnknown(std::uint64_t folder) {
  LockGuard guard(mutex_);
  return !looked_.contains(folder);
}

void DesktopThumbnails::forget(std::uint64_t folder) {
  LockGuard guard(mutex_);
  looked_.erase(folder);
}

void DesktopThumbnails::noteEverything() {
  LockGuard guard(mutex_);
  isAllToBeLookedAt_ = true;
  changed_.notifyAll();
}

bool DesktopThumbnails::mayBePicture(const std::string& name) {
  const std::string& type = ContentTypes::system().typeForName(name);
  // What a name does not tell, the desktop looks up in the file, whose start is always here.
  return isDrawableType(type) || type == ContentTypes::kUnknown ||
         InstalledThumbnailers::system().canDraw(type);
}

void DesktopThumbnails::noteLooked(std::uint64_t folder) {
  LockGuard guard(mutex_);
  looked_.insert(folder);
}

void DesktopThumbnails::note(Look look) {
  if (look.folder.base == Places::kTrash) return;
  LockGuard guard(mutex_);
  if (looks_.size() >= kLooks) {
    looked_.erase(look.folder.inode);
    return;
  }
  if (!noted_.insert(joined(look.folder.onDisk, look.name)).second) return;
  looks_.push_back(std::move(look));
  changed_.notifyAll();
}

bool DesktopThumbnails::isEnding() {
  LockGuard guard(mutex_);
  return isEnding_;
}

void DesktopThumbnails::run() {
  giveWayToOthers();
  for (;;) {
    lookAtNoted();
    lookAtMissed();
    {
      const auto due = nextDue();
      LockGuard guard(mutex_);
      while (looks_.empty() && !isAllToBeLookedAt_ && !isEnding_ && Clock::now() < due) {
        if (due == Clock::time_point::max()) {
          changed_.wait(mutex_);
        } else {
          (void)changed_.waitUntil(mutex_, due);
        }
      }
      if (isEnding_) return;
      if (!looks_.empty() || !isAllToBeLookedAt_) continue;
      isAllToBeLookedAt_ = false;
      looked_.clear();
    }
    lookAtAll();
    fetchWaiting();
  }
}

/// What somebody looks at comes first, also while all is looked at.
void DesktopThumbnails::lookAtNoted() {
  for (;;) {
    Look look;
    {
      LockGuard guard(mutex_);
      if (looks_.empty() || isEnding_) return;
      look = std::move(looks_.front());
      looks_.pop_front();
      noted_.erase(joined(look.folder.onDisk, look.name));
    }
    lookAt(look);
    fetchWaiting();
  }
}

void DesktopThumbnails::lookAtAll() {
  const auto& root = places_.base(Places::kRoot);
  lookAtTree({.base = Places::kRoot,
              .inode = root.identity.inode,
              .onDisk = root.path,
              .location = root.path,
              .shown = {}},
             0);
  for (const auto& shown : places_.shownBases()) {
    if (shown.base == Places::kTrash || isEnding()) continue;
    const auto& base = places_.base(shown.base);
    lookAtTree({.base = shown.base,
                .inode = base.identity.inode,
                .onDisk = base.path,
                .location = base.path,
                .shown = "/" + shown.name},
               0);
  }
}

void DesktopThumbnails::lookAtTree(const Folder& folder, int depth) {
  DIR* const stream = depth < kDeepest ? opendir(folder.onDisk.c_str()) : nullptr;
  if (stream == nullptr) return;
  noteLooked(folder.inode);
  std::vector<Folder> folders;
  while (const dirent* const entry = readdir(stream)) {
    const std::string name = entry->d_name;
    if (name == "." || name == ".." || isEnding()) continue;
    if (entry->d_type == DT_REG) {
      consider(folder, name, 0);
    } else if (entry->d_type == DT_DIR) {
      const std::string shown = places_.shownName(folder.inode, name);
      folders.push_back({.base = folder.base,
                         .inode = entry->d_ino,
                         .onDisk = joined(folder.onDisk, name),
                         .location = joined(folder.location, shown),
                         .shown = joined(folder.shown, shown)});
    }
  }
  closedir(stream);
  lookAtNoted();
  for (const Folder& each : folders) lookAtTree(each, depth + 1);
}

void DesktopThumbnails::lookAt(const Look& look) {
  if (!look.name.empty()) return consider(look.folder, look.name, 0);
  lookAtFolder(look.folder, 0);
}

void DesktopThumbnails::lookAtFolder(const Folder& folder, int looksAgain) {
  DIR* const stream = opendir(folder.onDisk.c_str());
  if (stream == nullptr) return;
  noteLooked(folder.inode);
  while (const dirent* const entry = readdir(stream)) {
    if (isEnding()) break;
    if (entry->d_type == DT_REG) consider(folder, entry->d_name, looksAgain);
  }
  closedir(stream);
}

void DesktopThumbnails::lookAtMissed() {
  const auto now = Clock::now();
  std::vector<Missed> due;
  std::erase_if(missed_, [&](auto& each) {
    if (each.second.due > now) return false;
    due.push_back(std::move(each.second));
    return true;
  });
  if (due.empty() || lookingAgain.hit()) return;
  for (const Missed& each : due) {
    if (isEnding()) return;
    lookAtFolder(each.folder, each.looksAgain);
    fetchWaiting();
    lookAtNoted();
  }
}

void DesktopThumbnails::consider(const Folder& folder, const std::string& name, int looksAgain) {
  const std::string shown = places_.shownName(folder.inode, name);
  if (!mayBePicture(shown)) return;
  const std::string onDisk = joined(folder.onDisk, name);
  struct stat status{};
  if (lstat(onDisk.c_str(), &status) != 0 || !S_ISREG(status.st_mode) || status.st_size == 0)
    return;
  if (!isFaultAtPath(onDisk)) return;
  ThumbnailCache::File file{.path = mountPoint_ + joined(folder.shown, shown),
                            .mtime = status.st_mtim.tv_sec,
                            .size = static_cast<std::uint64_t>(status.st_size)};
  bool isThere = true;
  for (const Flavour flavour : kFlavours) isThere = isThere && cache_.has(file, flavour);
  if (isThere) return;
  waiting_.push_back({.file = std::move(file),
                      .location = joined(folder.location, shown),
                      .folder = folder,
                      .looksAgain = looksAgain});
  if (waiting_.size() >= kTogether) fetchWaiting();
}

void DesktopThumbnails::fetchWaiting() {
  std::vector<Candidate> candidates = std::exchange(waiting_, {});
  std::map<std::string, Candidate*> byIdentifier;
  std::vector<std::string> asked;
  std::vector<std::string> large;
  NSErrorRef error;
  for (Candidate& each : candidates) {
    std::string identifier;
    if (isEnding()) return;
    error = requests_.identify(each.location, identifier);
    if (error || !byIdentifier.try_emplace(identifier, &each).second) continue;
    // Of a large one without a thumbnail the host may have the content brought here, to be drawn.
    (each.file.size > largest_ ? large : asked).push_back(identifier);
  }
  const auto take = [&](const std::string& identifier, const NSDataRef& image) {
    const auto found = byIdentifier.find(identifier);
    if (!image || found == byIdentifier.end() || isEnding()) return;
    found->second->hasImage = true;
    store(found->second->file, image);
  };
  if (!byIdentifier.empty()) error = nullptr;
  if (!asked.empty()) error = requests_.fetch(asked, take);
  if (!large.empty()) {
    const NSErrorRef failure = requests_.readStored(large, take);
    if (failure) error = failure;
  }
  for (const Candidate& each : candidates) {
    if (!each.hasImage) noteMissed(each);
  }
  if (!error) return;
  log_info(defaultLog(), "[INFO] some thumbnails are not to be had now: %@", error);
  LockGuard guard(mutex_);
  looked_.clear();
}

void DesktopThumbnails::noteMissed(const Candidate& candidate) {
  if (candidate.looksAgain >= kLooksAgain) return;
  const std::string& place = candidate.folder.onDisk;
  const auto known = missed_.find(place);
  if (known == missed_.end() && missed_.size() >= kMissed) return;
  const int next = candidate.looksAgain + 1;
  const auto due = Clock::now() + pauseBefore(next);
  // What has only now been missed is not to wait for as long as what has been for hours.
  if (known != missed_.end() && known->second.due <= due) return;
  missed_.insert_or_assign(place, Missed{candidate.folder, next, due});
}

DesktopThumbnails::Clock::time_point DesktopThumbnails::nextDue() const {
  auto next = Clock::time_point::max();
  for (const auto& [place, each] : missed_) next = std::min(next, each.due);
  return next;
}

void DesktopThumbnails::store(const ThumbnailCache::File& file, const NSDataRef& image) {
  FileDescriptor source = fileOf(image->bytes());
  NSErrorRef error;
  for (const Flavour flavour : kFlavours) {
    auto picture =
        drawer_.draw(source.get(), static_cast<std::uint32_t>(flavour), drawing::Form::Png, &error);
    if (picture) error = cache_.store(file, flavour, contentOf(*picture));
    if (!picture || error) break;
    source = std::move(picture->file);  // the next is smaller
  }
  if (error) log_info(defaultLog(), "[INFO] no thumbnail for the desktop: %@", error);
}

}  // namespace yomber
