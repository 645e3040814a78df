#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "zarn/file_descriptor.h"
#include "zarn/item_attributes.h"

namespace yomber {

enum class EntryType : std::uint8_t { File, Folder, Symlink };

/// One file, folder or symbolic link as the disk has it.
struct FolderEntry {
  std::uint32_t nameOffset = 0;  ///< in the snapshot's `names`
  std::uint16_t nameLength = 0;
  EntryType type = EntryType::File;
  bool hasBirthTime = false;
  bool isSettled = false;  ///< a later change has another ctime
  std::uint32_t mode = 0;
  std::uint32_t links = 0;
  std::uint64_t inode = 0;
  std::uint64_t size = 0;
  std::int64_t mtime = 0;  // times in ns since the epoch
  std::int64_t ctime = 0;
  std::int64_t btime = 0;   ///< the modification time where the disk keeps none
  std::uint64_t visit = 0;  ///< of a folder: which visit will read it

  /// Whether its id is kept in an attribute; else in the database only.
  [[nodiscard]] bool carriesID() const {
    return type == EntryType::Folder || (type == EntryType::File && links == 1);
  }
  /// The ctime, or one that no look finds where a later change may have this one too.
  [[nodiscard]] std::int64_t changeTimeToRemember() const { return isSettled ? ctime : ctime - 1; }
};

/// A folder's entries as they were when it was read. What never syncs, and what is neither file nor
/// folder nor symbolic link, is left out.
struct FolderSnapshot {
  std::uint64_t visit = 0;
  std::uint64_t rankBefore = 0;  ///< rows with a higher rank may be newer than this
  bool isReadable = false;       ///< else nothing but `visit` counts
  bool isPartial = false;        ///< some entries could not be looked at: absence proves nothing
  FolderEntry self;
  std::shared_ptr<const FileDescriptor> folder;  ///< open on the folder
  std::string names;
  std::vector<FolderEntry> entries;
  /// Those that say anything, by the entries' index, when they were asked for.
  std::vector<std::pair<std::size_t, ItemAttributes>> attributes;

  [[nodiscard]] std::string_view nameOf(const FolderEntry& entry) const {
    return std::string_view(names).substr(entry.nameOffset, entry.nameLength);
  }
  [[nodiscard]] const ItemAttributes& attributesOf(std::size_t entry) const;
};

/// Looks at `name` in the open folder, or with an empty name at the folder itself. False when it is
/// gone, cannot be looked at, or is of no kind that the drive holds; errno says which (EINVAL:
/// kind).
[[nodiscard]] bool lookAtEntry(int folder, const char* name, FolderEntry& out);

/// Reads all entries of the open folder. Answers errno, 0 when all were read. What is
/// mounted inside the tree is left out.
[[nodiscard]] int readFolderEntries(int folder, FolderSnapshot& snapshot);

}  // namespace yomber
