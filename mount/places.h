#pragma once

#include <atomic>
#include <cstdint>
#include <deque>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "mount/file_identity.h"
#include "platform/foundation/error.h"
#include "platform/foundation/file_descriptor.h"
#include "platform/foundation/lock.h"

namespace yomber {

/// Where things are on this disk, and what they are called in the mount.
///
/// A *base* is a folder that the mount shows in its root although it lies elsewhere in the tree (a
/// container's Documents, the trash); the root is the first one. Everything else lies below a base.
/// Its name is that on the disk, save for the few items whose name the disk cannot hold beside
/// another one's: those are shown under the drive's name.
///
/// Thread-safety: every operation may be called on any thread. A base, once there, stays.
class Places {
 public:
  static constexpr std::uint32_t kRoot = 0;
  static constexpr std::uint32_t kTrash = 1;

  /// `root` and `trash` are locations of folders.
  static std::unique_ptr<Places> open(const std::string& root, const std::string& trash,
                                      NSErrorRef* error);

  struct Base {
    std::string path;
    FileDescriptor folder;  ///< O_PATH
    FileIdentity identity;
  };
  [[nodiscard]] const Base& base(std::uint32_t number) const;
  /// The base that the root shows under that name.
  [[nodiscard]] std::optional<std::uint32_t> shownBase(std::string_view name) const;
  struct ShownBase {
    std::string name;
    std::uint32_t base = 0;
  };
  [[nodiscard]] std::vector<ShownBase> shownBases() const;
  [[nodiscard]] std::string shownNameOfBase(std::uint32_t number) const;

  /// A container's folder is shown in the root under that name, or not any more (no name). A
  /// location that cannot be opened is not shown.
  void showContainer(const std::string& location, const std::string& name);
  /// An entry of the folder with that inode is shown under another name than on the disk, or not
  /// any more (no name).
  void showName(std::uint64_t folder, const std::string& diskName, const std::string& name);
  /// No containers and no names.
  void forgetShown();

  [[nodiscard]] std::string nameOnDisk(std::uint64_t folder, std::string_view shownName) const;
  [[nodiscard]] std::string shownName(std::uint64_t folder, std::string_view nameOnDisk) const;

 private:
  using Name = std::pair<std::uint64_t, std::string>;

  Places() = default;
  NSErrorRef addBase(const std::string& path, std::uint32_t& number);

  mutable Mutex mutex_;
  std::deque<Base> bases_ GUARDED_BY(mutex_);  // never shrinks: references stay valid
  std::map<std::string, std::uint32_t, std::less<>> shownBases_ GUARDED_BY(mutex_);
  std::map<Name, std::string> shownByDisk_ GUARDED_BY(mutex_);
  std::map<Name, std::string> diskByShown_ GUARDED_BY(mutex_);
  std::atomic<bool> hasShownNames_ = false;  ///< spares nearly all lookups the lock
  std::string trashName_;                    ///< constant
};

}  // namespace yomber
