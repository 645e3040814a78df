#include "platform/fileprovider/item_kind_name.h"

namespace yomber {

const char* itemKindName(ItemKind kind) {
  switch (kind) {
    case ItemKind::Document:
      return "document";
    case ItemKind::Folder:
      return "folder";
    case ItemKind::Alias:
      return "alias";
    case ItemKind::Bookmark:
      return "bookmark";
    case ItemKind::Symlink:
      return "symlink";
  }
  return "document";
}

}  // namespace yomber
