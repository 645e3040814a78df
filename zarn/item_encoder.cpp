#include "zarn/item_encoder.h"

#include <array>
#include <charconv>
#include <string_view>

#include "platform/fileprovider/item_codec.h"

namespace yomber {

namespace {

/// An identifier without a string on the heap.
class IdentifierText {
 public:
  IdentifierText(std::uint64_t id, ItemKind kind) {
    if (id == kRootID || id == kTrashID) {
      text_ = id == kRootID ? NSFileProviderRootContainerItemIdentifier
                            : NSFileProviderTrashContainerItemIdentifier;
    } else {
      buffer_[0] = identifierLetter(kind);
      buffer_[1] = ':';
      const auto end = std::to_chars(buffer_.data() + 2, buffer_.data() + buffer_.size() - 1, id);
      *end.ptr = '\0';
      text_ = std::string_view(buffer_.data(), static_cast<std::size_t>(end.ptr - buffer_.data()));
    }
  }
  /// Ends with a zero byte, as the wire wants it.
  [[nodiscard]] capnp::Text::Reader wire() const { return {text_.data(), text_.size()}; }

 private:
  std::array<char, 24> buffer_;
  std::string_view text_;
};

void encodeExtra(const ItemExtra& extra, protocol::Item::Builder builder) {
  if (extra.lastUsed) builder.initLastUsedDate().setValue(*extra.lastUsed);
  if (extra.favoriteRank) builder.initFavoriteRank().setValue(*extra.favoriteRank);
  if (!extra.tags.empty()) {
    auto tags = builder.initTags(static_cast<unsigned>(extra.tags.size()));
    for (unsigned i = 0; i < tags.size(); ++i) tags.set(i, wireText(extra.tags[i]));
  }
  if (!extra.containerID.empty()) builder.setContainerID(wireText(extra.containerID));
}

constexpr std::uint64_t pointedWords(std::size_t bytes) { return bytes / sizeof(capnp::word) + 1; }

std::uint64_t extraWords(const ItemExtra& extra) {
  constexpr std::uint64_t kOptionals = 8;
  std::uint64_t words = kOptionals + pointedWords(extra.containerID.size());
  for (const auto& tag : extra.tags) words += 1 + pointedWords(tag.size());
  return words;
}

std::uint64_t rowWords(const ItemRow& row, const std::string& contentType) {
  // The structure itself, and two identifiers: the constants are the longest.
  constexpr std::uint64_t kFixed = 20 + 2 * 7;
  std::uint64_t words = kFixed + pointedWords(row.name.size()) + pointedWords(contentType.size());
  if (row.extra) words += extraWords(*row.extra);
  return words;
}

}  // namespace

void encodeRow(const ItemRow& row, protocol::Item::Builder builder) {
  encodeRow(row, itemContentType(row), builder);
}

void encodeRow(const ItemRow& row, const std::string& contentType,
               protocol::Item::Builder builder) {
  builder.setIdentifier(IdentifierText(row.id, row.kind).wire());
  const std::uint64_t parent = row.parent == kNoParent ? kRootID : row.parent;
  builder.setParentIdentifier(IdentifierText(parent, ItemKind::Folder).wire());
  builder.setFilename(wireData(row.name));
  builder.setContentType(wireText(contentType));
  builder.setKind(static_cast<protocol::Item::Kind>(row.kind));
  builder.setRawID(row.id);
  builder.setSize(row.size);
  builder.setCreationDate(row.btime);
  builder.setModificationDate(row.mtime);
  builder.setCapabilities(itemCapabilities(row));
  builder.setFlags(itemWireFlags(row));
  builder.setRank(row.rank);
  builder.setVersion(itemVersion(row));
  if (row.extra) encodeExtra(*row.extra, builder);
}

void encodeDeadItem(std::uint64_t id, ItemKind kind, protocol::Item::Builder builder) {
  builder.setIdentifier(IdentifierText(id, kind).wire());
  builder.setKind(static_cast<protocol::Item::Kind>(kind));
  builder.setRawID(id);
  builder.setFlags(row_flag::kDead);
}

std::uint64_t encodedRowWords(const ItemRow& row) { return rowWords(row, itemContentType(row)); }

std::uint64_t encodedPageWords(const ListingPage& page) {
  std::uint64_t words = 8;
  for (std::size_t i = 0; i < page.rows.size(); ++i) {
    words += rowWords(page.rows[i], *page.contentTypes[i]);
  }
  return words;
}

}  // namespace yomber
