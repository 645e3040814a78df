#pragma once

#include <chrono>
#include <cstdint>
#include <deque>
#include <map>
#include <memory>
#include <string>
#include <thread>
#include <unordered_set>
#include <vector>

#include "mount/places.h"
#include "mount/thumbnail_requests.h"
#include "platform/drawing/picture_drawer.h"
#include "platform/foundation/lock.h"
#include "platform/glimmet/thumbnail_cache.h"

namespace yomber {

/// Keeps the desktop's own store of thumbnails filled for what the mount shows and whose content is
/// away, so that file managers show pictures without asking for content. What is here they draw
/// themselves.
///
/// All of the tree is looked through once zarn tells of changes, an entry when it changes (it was
/// given up, say), and a folder when it is listed and was not looked at since it changed. Pictures
/// come from the record store, over the host or straight from it, and no content is brought here
/// for them. A folder in which something is to be had later, perhaps, is looked at again by and by,
/// a few times. Thread-safety: every operation may be called on any thread, and returns at once; a
/// thread of its own does the work.
class DesktopThumbnails {
 public:
  /// `mountPoint`: the absolute path of the mount.
  DesktopThumbnails(const Places& places, std::string mountPoint, std::string controlSocket,
                    ThumbnailCache cache);
  ~DesktopThumbnails();
  DesktopThumbnails(const DesktopThumbnails&) = delete;
  DesktopThumbnails& operator=(const DesktopThumbnails&) = delete;

  /// A folder, and its ways.
  struct Folder {
    std::uint32_t base = Places::kRoot;
    std::uint64_t inode = 0;
    std::string onDisk;    ///< its location on this disk
    std::string location;  ///< as the drive has it
    std::string shown;     ///< as the mount shows it, below the mount point; empty: the root
  };
  /// Whether the folder with that inode is worth telling of when it is listed. Costs next to
  /// nothing, since every listing asks.
  [[nodiscard]] bool isUnknown(std::uint64_t folder);
  /// The folder is being listed.
  void noteListing(Folder folder);
  /// The entry of the folder, by its name on this disk, may be away since now.
  void noteChange(Folder folder, std::string name);
  /// Entries of the folder with that inode may be; where it is, is not known.
  void forget(std::uint64_t folder);
  /// Anything may have changed, or containers have come to be shown.
  void noteEverything();
  /// Whether it may be anything that has a thumbnail.
  [[nodiscard]] static bool mayBePicture(const std::string& name);

 private:
  /// A folder, or one entry of it.
  struct Look {
    Folder folder;
    std::string name;  ///< empty: all of them
  };
  struct Candidate {
    ThumbnailCache::File file;
    std::string location;
    Folder folder;
    int looksAgain = 0;  ///< as for a missed folder, before this one
    bool hasImage = false;
  };
  using Clock = std::chrono::steady_clock;
  /// A folder in which there was no thumbnail of something.
  struct Missed {
    Folder folder;
    int looksAgain = 0;  ///< how often it was looked at again by then
    Clock::time_point due;
  };

  void note(Look look);
  void noteLooked(std::uint64_t folder);
  void run();
  [[nodiscard]] bool isEnding();
  void lookAtNoted();
  void lookAtAll();
  void lookAtTree(const Folder& folder, int depth);
  void lookAt(const Look& look);
  void lookAtFolder(const Folder& folder, int looksAgain);
  void lookAtMissed();
  /// Looks at the entry; one that needs a thumbnail waits until there are some.
  void consider(const Folder& folder, const std::string& name, int looksAgain);
  void fetchWaiting();
  void noteMissed(const Candidate& candidate);
  /// When a missed folder is to be looked at; never, where there is none.
  [[nodiscard]] Clock::time_point nextDue() const;
  void store(const ThumbnailCache::File& file, const NSDataRef& image);

  const Places& places_;
  const std::string mountPoint_;
  const ThumbnailCache cache_;
  PictureDrawer drawer_;
  ThumbnailRequests requests_;
  const std::uint64_t largest_;  ///< bytes of what the host is asked about
  // The thread's own.
  std::vector<Candidate> waiting_;
  std::map<std::string, Missed> missed_;  ///< by the folder's location on this disk

  Mutex mutex_;
  Condition changed_;
  std::deque<Look> looks_ GUARDED_BY(mutex_);
  std::unordered_set<std::string> noted_ GUARDED_BY(mutex_);     ///< what is in `looks_`
  std::unordered_set<std::uint64_t> looked_ GUARDED_BY(mutex_);  ///< inodes of folders
  bool isAllToBeLookedAt_ GUARDED_BY(mutex_) = false;
  bool isEnding_ GUARDED_BY(mutex_) = false;
  std::thread thread_;
};

}  // namespace yomber
