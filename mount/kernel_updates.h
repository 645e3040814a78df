#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "mount/file_system.h"

namespace yomber {

/// Tells the kernel what it keeps that no longer holds, and nothing else: what came through the
/// mount itself it knows already. What concerns entries is told when `tellEntries` is called.
///
/// For one thread at a time, and none that answers requests.
class KernelUpdates {
 public:
  KernelUpdates(FileSystem& files, KernelSession& session);

  /// The entry of the folder with that inode has appeared, changed or gone.
  void entryChanged(std::uint64_t folder, const std::string& nameOnDisk);
  /// Any entry of the folder may have.
  void folderChanged(std::uint64_t folder);
  /// The folder's own attributes have.
  void attributesChanged(std::uint64_t folder);
  /// Anything may have.
  void anythingChanged();

  /// As the functions of Places of these names.
  void showName(std::uint64_t folder, const std::string& nameOnDisk, const std::string& name);
  void showContainer(const std::string& location, const std::string& name);
  void forgetShown() { files_.places().forgetShown(); }

  /// To be called after the others.
  void tellEntries();

 private:
  void noteEntry(Node& folder, const std::string& name, bool isOther);
  void entryMayHaveChanged(Node& folder, const std::string& nameOnDisk);
  /// What is known in a place, when that is not what is there any more.
  struct Found {
    NodeUse known;
    bool isOther = false;
    struct statx status{};
    bool isThere = false;
  };
  Found lookAgain(Node& folder, int descriptor, const std::string& nameOnDisk);
  void nodeChanged(Node& node, std::int64_t change);
  /// Content and attributes.
  void nodeIsOther(Node& node);

  class Dropping;

  FileSystem& files_;
  KernelSession& session_;
  const std::shared_ptr<Dropping> dropping_;
  std::vector<EntryNotices::Notice> entries_;  ///< that are to be told
};

}  // namespace yomber
