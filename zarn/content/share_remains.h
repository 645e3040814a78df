#pragma once

#include <sys/stat.h>

#include <cstdint>
#include <optional>
#include <string>
#include <unordered_map>
#include <vector>

#include "platform/foundation/error.h"
#include "zarn/content/content_core.h"
#include "zarn/content/shared_tree.h"

namespace yomber {

/// What is known of an item of a share, and of all below it, when it is to go.
struct GoingItems {
  enum class Fate : std::uint8_t {
    Goes,    ///< a document; it goes when the store has what it holds
    Opened,  ///< a folder; what is in it is looked at one by one
    Stays,   ///< the account's own, with all below it: it has nothing in the share
  };
  struct Item {
    std::uint64_t id = 0;
    std::uint64_t parent = 0;
    Fate fate = Fate::Goes;
    bool isOtherShare = false;
    std::optional<ContentRow> content;
  };
  std::unordered_map<std::uint64_t, Item> byInode;
  std::vector<std::uint64_t> documents;  ///< those that go

  /// `root`: the shared item, or a folder in it; `zone`: the share's.
  [[nodiscard]] static NSErrorRef read(const ContentCore& core, const ItemRow& root,
                                       const RZRecordZoneID& zone, GoingItems& items);
  /// Folders from which something has yet to be moved away.
  [[nodiscard]] std::vector<std::uint64_t> foldersOfStaying() const;
};

/// Moves away what must not go with an item of a share: the account's own under their ids, what was
/// not saved as kept copies, and what no row knows into a folder of its own. For one thread at a
/// time.
class ShareRemains {
 public:
  /// `folder`: where to; `name`: the item's.
  ShareRemains(const ContentCore& core, const SharedTree& tree, const GoingItems& items,
               std::string folder, std::string name)
      : core_(core),
        tree_(tree),
        items_(items),
        folder_(std::move(folder)),
        name_(std::move(name)) {}

  /// Looks at what is on the disk at `top`, where the item is.
  [[nodiscard]] NSErrorRef keep(const std::string& top);
  /// Removes what may go, one by one; what has come since is kept all the same. EBUSY while more
  /// and more comes.
  [[nodiscard]] NSErrorRef remove(const std::string& top);

 private:
  NSErrorRef keepOne(const std::string& path, bool isTop, std::vector<std::string>& rest);
  NSErrorRef keepCopy(const std::string& path, const std::string& name) const;
  NSErrorRef bringBack(const std::string& taken, const std::string& name) const;
  NSErrorRef removeOne(const std::string& path, bool isTop, std::vector<std::string>& entries);
  NSErrorRef removeDocument(const std::string& path, const std::string& name,
                            const std::optional<ContentRow>& content) const;
  /// `parent`, `nameThere`: the place of its row.
  NSErrorRef keepOwn(const std::string& path, std::uint64_t parent, const std::string& nameThere,
                     bool isOtherShare) const;
  NSErrorRef keepUnseen(const std::string& path, const struct stat& status);
  NSErrorRef keepUnknown(const std::string& path);
  [[nodiscard]] const GoingItems::Item* find(std::uint64_t inode) const;

  const ContentCore& core_;
  const SharedTree& tree_;
  const GoingItems& items_;
  const std::string folder_;
  const std::string name_;
  std::string unknownFolder_;  ///< made when there is something for it
};

}  // namespace yomber
