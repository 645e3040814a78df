#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "platform/rozzel/record.h"
#include "zarn/content/content_rows.h"
#include "zarn/content/share_rows.h"
#include "zarn/item_row.h"

namespace yomber {

/// What a record of a share says about an item.
struct SharedRecord {
  std::uint64_t id = 0;
  bool isFolder = false;
  std::string name;
  std::uint64_t parent = 0;
  RZAsset content;  ///< not of folders
  std::int64_t mtime = 0;
  std::string tag;

  /// Nothing for a record that no item of this drive can be like.
  static std::optional<SharedRecord> read(const RZRecord& record);
};

/// The id of the item whose record has that name; nothing when no item has such a record.
[[nodiscard]] std::optional<std::uint64_t> itemOfRecord(std::string_view recordName);

/// Whether a record is as it is known here, but for what is no item's business, as a thumbnail.
[[nodiscard]] bool saysTheSame(const SharedRecord& record, const ContentRow& known);

/// What is known of one item of a share, on both sides.
struct SharedItem {
  std::uint64_t id = 0;
  std::optional<SharedRecord> record;  ///< nothing: the store has none (any more)
  std::optional<ItemRow> row;          ///< nothing: it is not here
  std::optional<ContentRow> content;
  std::string path;        ///< on this disk
  bool isInside = false;   ///< it is in the share, or the shared item itself
  bool isRefused = false;  ///< what was done here was refused: the record counts
  bool isFresh = false;    ///< its file has what the record says
  FileStamp stamp = {};    ///< of that file when it was looked at or made
  /// Where the record's content was about to be saved from here, which was not confirmed: the file
  /// that had it.
  std::optional<FileStamp> saving = {};
  bool isBeingRemoved = false;  ///< it went from here, about which the store is to be told

  [[nodiscard]] bool isRoot(const ShareRow& share) const { return id == share.root; }
  [[nodiscard]] bool isOwnSave() const { return saving && !isRefused; }
  /// Whether the record is known here already.
  [[nodiscard]] bool isOwnEcho(const ShareRow& share) const {
    return record && row && content && !isRefused && content->zone == share.zone &&
           content->tag == record->tag;
  }
};

/// Whether a file has content that the store does not have. `content` is what the store has. Where
/// the answer is no, `looked` gets the file as it was then.
[[nodiscard]] bool isUnsaved(const std::string& path, const std::optional<ContentRow>& content,
                             FileStamp* looked = nullptr);

}  // namespace yomber
