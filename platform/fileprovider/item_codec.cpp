#include "platform/fileprovider/item_codec.h"

namespace yomber {
namespace {

void encodeOptional(const std::optional<std::int64_t>& value, protocol::OptionalInt64::Builder to) {
  if (value) to.setValue(*value);
}

std::optional<std::int64_t> decodeOptional(protocol::OptionalInt64::Reader from) {
  if (!from.isValue()) return std::nullopt;
  return from.getValue();
}

ItemKind decodeKind(protocol::Item::Kind kind) {
  const auto number = static_cast<std::uint16_t>(kind);
  return number <= static_cast<std::uint16_t>(ItemKind::Symlink) ? static_cast<ItemKind>(number)
                                                                 : ItemKind::Document;
}

/// Of a text (with its closing zero) or bytes.
std::uint64_t pointedWords(std::size_t bytes) { return bytes / sizeof(capnp::word) + 1; }

}  // namespace

void encodeItem(const ItemFields& item, protocol::Item::Builder builder) {
  builder.setIdentifier(wireText(item.identifier));
  builder.setParentIdentifier(wireText(item.parentIdentifier));
  builder.setFilename(wireData(item.filename));
  builder.setContentType(wireText(item.contentType));
  builder.setKind(static_cast<protocol::Item::Kind>(item.kind));
  builder.setRawID(item.rawID);
  builder.setSize(item.size);
  builder.setCreationDate(item.creationDate.nanoseconds());
  builder.setModificationDate(item.modificationDate.nanoseconds());
  if (item.lastUsedDate) builder.initLastUsedDate().setValue(item.lastUsedDate->nanoseconds());
  if (item.favoriteRank) encodeOptional(item.favoriteRank, builder.initFavoriteRank());
  if (!item.tags.empty()) {
    auto tags = builder.initTags(static_cast<unsigned>(item.tags.size()));
    for (unsigned i = 0; i < tags.size(); ++i) tags.set(i, wireText(item.tags[i]));
  }
  builder.setCapabilities(item.capabilities);
  builder.setFlags(item.flags);
  builder.setRank(item.rank);
  builder.setVersion(item.version);
  builder.setChildCount(item.childCount);
  if (!item.containerID.empty()) builder.setContainerID(wireText(item.containerID));
}

ItemFields decodeItem(protocol::Item::Reader reader) {
  ItemFields item;
  item.identifier = stringFromWire(reader.getIdentifier());
  item.parentIdentifier = stringFromWire(reader.getParentIdentifier());
  item.filename = stringFromWire(reader.getFilename());
  item.contentType = stringFromWire(reader.getContentType());
  item.kind = decodeKind(reader.getKind());
  item.rawID = reader.getRawID();
  item.size = reader.getSize();
  item.creationDate = NSDate::fromNanoseconds(reader.getCreationDate());
  item.modificationDate = NSDate::fromNanoseconds(reader.getModificationDate());
  if (const auto used = decodeOptional(reader.getLastUsedDate())) {
    item.lastUsedDate = NSDate::fromNanoseconds(*used);
  }
  item.favoriteRank = decodeOptional(reader.getFavoriteRank());
  for (const auto tag : reader.getTags()) item.tags.push_back(stringFromWire(tag));
  item.capabilities = reader.getCapabilities();
  item.flags = reader.getFlags();
  item.rank = reader.getRank();
  item.version = reader.getVersion();
  item.childCount = reader.getChildCount();
  item.containerID = stringFromWire(reader.getContainerID());
  return item;
}

void encodeItems(const NSFileProviderItems& items, capnp::List<protocol::Item>::Builder builder) {
  for (unsigned i = 0; i < builder.size(); ++i) encodeItem(items[i]->fields(), builder[i]);
}

std::uint64_t encodedItemWords(const ItemFields& item) {
  constexpr std::uint64_t kStructWords =
      protocol::Item::_capnpPrivate::dataWordSize + protocol::Item::_capnpPrivate::pointerCount;
  std::uint64_t words = kStructWords + pointedWords(item.identifier.size()) +
                        pointedWords(item.parentIdentifier.size()) +
                        pointedWords(item.filename.size()) + pointedWords(item.contentType.size()) +
                        pointedWords(item.containerID.size());
  constexpr std::uint64_t kOptionalWords = 2;
  if (item.lastUsedDate) words += kOptionalWords;
  if (item.favoriteRank) words += kOptionalWords;
  for (const auto& tag : item.tags) words += 1 + pointedWords(tag.size());
  return words;
}

}  // namespace yomber
