#pragma once

#include <cstdint>

#include "platform/fileprovider/item.h"
#include "protocols/common.capnp.h"

namespace yomber {

// Items on the wire. Not for extensions: this header shows Cap'n Proto types.

/// Writes every field. `builder` must be fresh.
void encodeItem(const ItemFields& item, protocol::Item::Builder builder);
/// Reads every field; a kind that is not known reads as a document.
[[nodiscard]] ItemFields decodeItem(protocol::Item::Reader reader);

/// Writes the items in their order; none may be nil.
void encodeItems(const NSFileProviderItems& items, capnp::List<protocol::Item>::Builder builder);

/// How many words an item takes in a message, its place in a list included; so that a page is built
/// in one piece.
[[nodiscard]] std::uint64_t encodedItemWords(const ItemFields& item);

/// A string as text on the wire, whatever its bytes are.
[[nodiscard]] inline capnp::Text::Reader wireText(const std::string& text) {
  return {text.c_str(), text.size()};
}
/// Bytes that need not be text: paths and file names.
[[nodiscard]] inline capnp::Data::Reader wireData(std::string_view bytes) {
  return {reinterpret_cast<const kj::byte*>(bytes.data()), bytes.size()};
}
[[nodiscard]] inline std::string stringFromWire(capnp::Text::Reader text) {
  return {text.begin(), text.size()};
}
[[nodiscard]] inline std::string stringFromWire(capnp::Data::Reader bytes) {
  return {reinterpret_cast<const char*>(bytes.begin()), bytes.size()};
}

}  // namespace yomber
