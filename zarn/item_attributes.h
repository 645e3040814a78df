#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "zarn/item_row.h"

namespace yomber {

/// The extended attributes in which files carry what the drive knows about them.
inline constexpr const char* kIDAttribute = "user.yomber.id";              ///< decimal raw id
inline constexpr const char* kFavoriteAttribute = "user.yomber.favorite";  ///< decimal rank
inline constexpr const char* kLastUsedAttribute = "user.yomber.lastused";  ///< decimal ns
inline constexpr const char* kSharedAttribute = "user.yomber.shared";      ///< by its presence
/// By its presence: in a share that this account may only read.
inline constexpr const char* kOnlyReadableAttribute = "user.yomber.readonly";
inline constexpr const char* kTagsAttribute = "user.xdg.tags";  ///< separated by commas

/// What a file's attributes say.
struct ItemAttributes {
  std::optional<std::uint64_t> id;
  bool isShared = false;
  bool isOnlyReadable = false;
  bool isFault = false;  ///< its content is not here
  ItemExtra extra;       ///< without the container

  [[nodiscard]] bool isEmpty() const {
    return !id && !isShared && !isOnlyReadable && !isFault && extra.isEmpty();
  }
};

/// Reads them; none where the file is gone or has none. Values that make no sense count as absent.
/// `path` may be relative to the thread's working directory; a final symbolic link is not followed.
[[nodiscard]] ItemAttributes readItemAttributes(const char* path);

/// Writes an attribute of the file `name` in the folder open as `folder` (without a value: removes
/// it), provided that it still has that inode. "." is the folder itself. Answers errno: 0 when it
/// is so now, ESTALE when another file is there.
[[nodiscard]] int writeItemAttribute(int folder, const std::string& name, std::uint64_t inode,
                                     const char* attribute,
                                     const std::optional<std::string>& value);

/// The same for all that an item's extra says of its file; stops at the first failure.
[[nodiscard]] int writeItemExtra(int folder, const std::string& name, std::uint64_t inode,
                                 const ItemExtra& extra);

/// Writes an id to the file `name` in the folder open as `folder`, provided that it still has that
/// inode. Answers whether it is there now.
bool stampItem(int folder, const std::string& name, std::uint64_t inode, std::uint64_t id);

/// A path by which `name` in the folder open as `folder` can be given to calls that take none but
/// paths, however deep the folder lies.
[[nodiscard]] std::string pathThroughDescriptor(int folder, std::string_view name);

}  // namespace yomber
